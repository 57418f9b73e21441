#include "Consent.h"
#include "Context.h"
#include "Texts.h"

#include "contacts/database/DamagedDatabase.h"
#include "daemon/DaemonControl.h"

namespace rolvane::cli {

// The store keeps what was published: nothing of the new database is known to be its former contents, so nothing is
// deleted there, and the daemon forgets what it knew when it meets another database.
void addDatabaseCommands(CLI::App& app, Context& context) {
    const auto yes = std::make_shared<bool>(false);
    addCommand(
        app, context, "new-database",
        "Begin with an empty contact database where the former one is gone. What is published stays on the store "
        "until it is published anew",
        [yes](CLI::App& command) { declareConsent(command, *yes); },
        [&context, yes] {
            requireNoDatabase({});
            requireConsent(context, *yes,
                           translated("Begin with 0 contacts? The former database is lost but for a backup, which "
                                      "`rolvane restore` brings back."),
                           translated("No database was made."));
            DaemonControl().stop();
            beginNewDatabase({});
            context.say(
                translated("A new contact database was made. Import contacts with `rolvane import`, and publish and "
                           "subscribe anew."));
        });
}

} // namespace rolvane::cli
