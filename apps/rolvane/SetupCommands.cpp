#include "SetupCommands.h"
#include "Setup.h"
#include "ValueNames.h"

namespace rolvane::cli {

void addSetupCommands(CLI::App& app, Context& context) {
    const auto o = std::make_shared<SetupOptions>();
    const auto subscribes = std::make_shared<bool>(false);
    CLI::App* setup = addCommand(
        app, context, "setup", "Set everything up: store, account, password; asks for what is not given",
        [&](CLI::App& c) {
            auto* line = c.add_option("invitation", o->invitation, "The line that somebody has sent you");
            auto* endpoint = c.add_option("--endpoint", o->endpoint,
                                          "The store's address, such as https://dav.example.org/dav/{user}/Contacts");
            auto* here = c.add_flag("--here", o->here, "A store on this machine, which is started for it");
            auto* user = c.add_option("--user", o->user, "User name on the store");
            auto* file = c.add_option("--ca-file", o->caFile, "PEM file of a private certificate authority")
                             ->type_name(kFileValue);
            auto* fingerprint = c.add_option("--fingerprint", o->fingerprint,
                                             "SHA-256 of the store's authority, which is fetched and believed then");
            line->excludes(endpoint)->excludes(here)->excludes(user)->excludes(file)->excludes(fingerprint);
            endpoint->excludes(here);
            file->excludes(fingerprint)->excludes(here);
            fingerprint->excludes(here);
            auto* password = c.add_option_group("password", "Where the password comes from; it is never an argument");
            password->add_flag("--keyring", o->keyring,
                               "Ask for it (or read a line of standard input) and keep it in the keyring");
            password->add_flag("--ask-password", o->askPassword,
                               "Ask for it (or read a line of standard input) and keep it in a file of mode 0600");
            password->add_option("--password-command", o->passwordCommand, "Command whose first line of output it is");
            password->add_option("--password-credential", o->passwordCredential, "Name of a systemd credential");
            password->add_option("--password-file", o->passwordFile, "File of mode 0600")->type_name(kFileValue);
            password->add_flag("--no-password", o->noPassword, "The store asks for none");
            password->require_option(0, 1);
            c.add_option("--import", o->imports, "A file of contacts to import (may be given again)")
                ->type_name(kFileValue);
            c.add_flag("--subscribe,!--no-subscribe", *subscribes, "Subscribe to whoever has sent the invitation");
            c.add_flag("--replace", o->replace, "Put it in the place of another account that is set up here");
            c.add_flag("--no-input", o->noInput, "Ask nothing");
        },
        nullptr);
    setup->final_callback([&context, o, subscribes, setup] {
        if (setup->get_option("--subscribe")->count() > 0) o->subscribes = *subscribes;
        Setup(context, *o).run();
    });
}

} // namespace rolvane::cli
