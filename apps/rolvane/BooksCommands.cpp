#include "Books.h"
#include "BooksAutostart.h"
#include "QrCode.h"
#include "Texts.h"
#include "ValueNames.h"

#include "foundation/Date.h"
#include "foundation/Paths.h"
#include "server/BooksDevices.h"

#include <fmt/format.h>
#include <iostream>

namespace rolvane::cli {

namespace {

using Json = nlohmann::ordered_json;

struct ServerOptions {
    std::string directory, listen, certificate, key, device;
    std::vector<std::string> hosts;
    int port = 0;
    bool tls = true, loopback = false, madeCertificate = false, accessLog = false, qr = false, renew = false;
};

std::string dateText(const BooksDevice& device) {
    return Date(std::chrono::duration<double>(device.lastUse->time_since_epoch()).count()).toISO8601();
}

Json devicesJson(const BooksDevices& devices) {
    Json all = Json::array();
    for (const BooksDevice& device : devices.all())
        all.push_back({{"name", device.name}, {"lastUse", device.lastUse ? Json(dateText(device)) : Json()}});
    return all;
}

std::string lastUseText(const Json& device) {
    return device["lastUse"].is_null() ? translated("never used")
                                       : tr("last used {}", shownDate(device["lastUse"].get<std::string>()));
}

Json serverJson(const BooksServer& server, const BooksOptions& options) {
    const BooksStatus status = server.status();
    const auto ifKnown = [&](const std::string& text) { return text.empty() ? Json() : Json(text); };
    return {{"on", status.on},
            {"process", status.pid ? Json(status.pid) : Json()},
            {"startedBy", status.managed ? Json("systemd") : Json()},
            {"port", status.port ? Json(status.port) : Json()},
            {"url", status.port ? Json(server.url()) : Json()},
            {"outsideURL", status.port ? ifKnown(server.outsideURL()) : Json()},
            {"caFile", options.tls && status.port ? ifKnown(server.caFile()) : Json()},
            {"fingerprint", ifKnown(server.fingerprint())},
            {"database", ifKnown(options.database)},
            {"errorLog", server.errorLog()},
            {"devices", devicesJson(BooksDevices(server.stateDirectory()))},
            {"links", linksJson(options)}};
}

std::string onText(const Json& told) {
    if (!told["on"].get<bool>()) return translated("off (`rolvane books on`)");
    if (told["startedBy"].is_null()) return tr("on, process {}", told["process"].get<int>());
    return told["process"].is_null() ? translated("on; the first connection starts their server")
                                     : tr("on, process {}, started by systemd", told["process"].get<int>());
}

void tell(Context& context, const BooksServer& server, const BooksOptions& options) {
    const Json told = serverJson(server, options);
    if (context.json) return context.print(told);
    const auto row = [&](const char* label, const std::string& text) { context.row(label, text); };
    const auto rowIfAny = [&](const char* label, const char* key) {
        if (!told[key].is_null()) row(label, told[key].get<std::string>());
    };
    row(translated("Address books"), onText(told));
    rowIfAny(translated("Address"), "url");
    rowIfAny(translated("From elsewhere"), "outsideURL");
    rowIfAny(translated("Authority"), "caFile");
    rowIfAny(translated("Fingerprint"), "fingerprint");
    rowIfAny(translated("Database"), "database");
    row(translated("Log"), told["errorLog"].get<std::string>());
    if (told["devices"].empty()) row(translated("Devices"), translated("none (`rolvane books device add NAME`)"));
    const char* label = translated("Devices");
    for (const Json& device : told["devices"]) {
        row(label, fmt::format("{} ({})", device["name"].get<std::string>(), lastUseText(device)));
        label = "";
    }
    for (const Json& link : told["links"]) row(translated("Linked"), linkText(link));
}

void switchOn(Context& context, CLI::App& command, const ServerOptions& options) {
    BooksOptions chosen = knownBooks(options.directory);
    const auto given = [&](const char* option) { return command.get_option(option)->count() > 0; };
    if (given("--loopback")) {
        chosen.listen.clear();
        chosen.hosts.clear();
    }
    if (given("--listen")) chosen.listen = options.listen;
    if (given("--host")) chosen.hosts = options.hosts;
    if (given("--made-certificate")) chosen.certificate = chosen.key = "";
    if (given("--certificate")) {
        chosen.certificate = options.certificate;
        chosen.key = options.key;
    }
    if (given("--port")) chosen.port = options.port;
    if (given("--tls")) chosen.tls = options.tls;
    if (given("--access-log")) chosen.accessLog = options.accessLog;
    context.database(); // makes it, or says why it cannot be used
    chosen.database = dataDirectory() + "/contacts.db";
    BooksServer server(chosen);
    server.on();
    if (options.directory.empty()) setBooksAutostart(!server.status().managed);
    tell(context, server, chosen);
    if (BooksDevices(server.stateDirectory()).all().empty())
        context.say(
            translated("Nobody can sign in yet: `rolvane books device add NAME` makes a password for each program or "
                       "device."));
}

void switchOff(Context& context, const ServerOptions& options) {
    BooksServer server(knownBooks(options.directory));
    const bool wasOn = server.status().on;
    server.off();
    if (options.directory.empty()) setBooksAutostart(false);
    context.say(wasOn ? translated("The address books are off; devices and contacts stay.")
                      : translated("The address books were off."));
}

// A character that a URL's user part may not hold, as an escape.
std::string escaped(const std::string& name) {
    std::string text;
    for (const char c : name)
        text += c == '@' || c == '+' ? fmt::format("%{:02X}", static_cast<unsigned>(c)) : std::string(1, c);
    return text;
}

// The address with name and password, as programs on phones take it from a QR code.
std::string signInLink(const std::string& url, const std::string& device, const std::string& password) {
    const size_t host = url.find("://") + 3;
    return (url.starts_with("https") ? "carddavs://" : "carddav://") + escaped(device) + ":" + password + "@" +
           url.substr(host);
}

void addDevice(Context& context, const ServerOptions& options) {
    const BooksServer server(knownBooks(options.directory));
    const std::string outside = server.status().port ? server.outsideURL() : "";
    const std::string url = outside.empty() ? server.url() : outside; // says what to do when there is none
    const BooksDevices devices(server.stateDirectory());
    const bool known = devices.contains(options.device);
    if (known && !options.renew)
        throw CommandError(kUsage, tr("There is a device {} already. `--renew` gives it another password, and "
                                      "the one that it has ends; or choose another name.",
                                      options.device));
    const std::string password = devices.add(options.device);
    const std::string link = signInLink(url, options.device, password);
    if (context.json)
        return context.print({{"device", options.device},
                              {"password", password},
                              {"url", url},
                              {"link", link},
                              {"fingerprint", server.fingerprint().empty() ? Json() : Json(server.fingerprint())}});
    const auto row = [&](const char* label, const std::string& text) { context.row(label, text); };
    row(translated("Address"), url);
    row(translated("User name"), options.device);
    row(translated("Password"), password);
    if (options.qr) {
        showQrCode(context, link);
        if (outside.empty())
            context.say(translated(
                "A phone does not reach this address: `rolvane books on --listen ADDRESS` opens the books to "
                "your network."));
    }
    context.say(tr("The password is shown this once. `rolvane books device remove {}` ends it.", options.device));
}

void removeDevice(Context& context, const ServerOptions& options) {
    const BooksServer server(knownBooks(options.directory));
    if (!BooksDevices(server.stateDirectory()).remove(options.device))
        throw CommandError(kNotFound, tr("There is no device {}. `rolvane books devices` lists them.", options.device));
    context.say(tr("{} can no longer sign in.", options.device));
}

void listDevices(Context& context, const ServerOptions& options) {
    const BooksServer server(knownBooks(options.directory));
    const Json devices = devicesJson(BooksDevices(server.stateDirectory()));
    if (context.json) return context.print(devices);
    for (const Json& device : devices)
        context.line(fmt::format("{:<20}{}", device["name"].get<std::string>(), lastUseText(device)));
    if (devices.empty()) context.say(translated("No device can sign in. `rolvane books device add NAME` adds one."));
}

} // namespace

BooksOptions knownBooks(const std::string& directory) {
    if (auto saved = BooksServer::savedOptions(directory)) return *saved;
    BooksOptions fresh;
    fresh.stateDirectory = directory;
    return fresh;
}

nlohmann::ordered_json booksJson() {
    const BooksOptions options = knownBooks();
    const BooksServer server(options);
    const BooksStatus status = server.status();
    if (!status.port) return nullptr;
    return {{"on", status.on},
            {"url", server.url()},
            {"devices", BooksDevices(server.stateDirectory()).all().size()},
            {"links", linksJson(options)}};
}

std::string booksText(const nlohmann::ordered_json& books) {
    if (books.is_null()) return {};
    return tr("{} at {}, {}", books["on"].get<bool>() ? translated("on") : translated("off"),
              books["url"].get<std::string>(), countedText(books["devices"].get<size_t>(), "device", "devices"));
}

void addBooksCommands(CLI::App& app, Context& context) {
    CLI::App* books = addCommand(app, context, "books",
                                 "Your contacts as address books (CardDAV) for programs and phones", nullptr, nullptr);
    books->require_subcommand(1);
    const auto o = std::make_shared<ServerOptions>();
    const auto directory = [o](CLI::App& c) {
        c.add_option("--directory", o->directory, "The server's own directory, for several servers")
            ->type_name(kDirectoryValue);
    };
    CLI::App* on = addCommand(
        *books, context, "on", "Serve them on this machine; returns when the server answers",
        [&](CLI::App& c) {
            directory(c);
            auto* listen = c.add_option("--listen", o->listen,
                                        "An address of this machine for your network, or 0.0.0.0 for all; needs TLS");
            c.add_flag("--loopback", o->loopback, "This machine alone, which is so at first")->excludes(listen);
            c.add_option("--host", o->hosts, "Another name or address in the certificate (may be given again)");
            auto* certificate = c.add_option("--certificate", o->certificate,
                                             "A certificate of your own (PEM, with those that sign it); needs --key");
            auto* key = c.add_option("--key", o->key, "Its key (PEM)")->needs(certificate);
            certificate->needs(key)->type_name(kFileValue);
            key->type_name(kFileValue);
            c.add_flag("--made-certificate", o->madeCertificate,
                       "The one that this machine makes, which is so at first")
                ->excludes(certificate);
            c.add_option("--port", o->port, "Port; the one of the last time, else a free one")
                ->check(CLI::Range(1, 65535));
            c.add_flag("--tls,!--no-tls", o->tls, "With TLS, which is so at first, or plain http on this machine");
            c.add_flag("--access-log,!--no-access-log", o->accessLog,
                       "Write a line for every request to logs/access.log");
        },
        nullptr);
    on->final_callback([&context, o, on] { switchOn(context, *on, *o); });
    addCommand(*books, context, "off", "Stop the server; devices and contacts stay", directory,
               [&context, o] { switchOff(context, *o); });
    addCommand(*books, context, "status", "Tell whether they are on, where, and for whom (exit code 0 or 3)", directory,
               [&context, o] {
                   const BooksOptions known = knownBooks(o->directory);
                   const BooksServer server(known);
                   tell(context, server, known);
                   if (!server.status().on) context.exitCode = kNotFound;
               });
    addCommand(*books, context, "devices", "List who may sign in, and when they last did", directory,
               [&context, o] { listDevices(context, *o); });
    CLI::App* device = addCommand(*books, context, "device", "Passwords of programs and devices", nullptr, nullptr);
    device->require_subcommand(1);
    const auto named = [&, directory, o](CLI::App& c) {
        directory(c);
        c.add_option("name", o->device, "A name of your choice: the user name of the device")
            ->required()
            ->type_name(kDeviceValue);
    };
    addCommand(
        *device, context, "add", "Make a password for a program or device, and show it once",
        [&, named, o](CLI::App& c) {
            named(c);
            c.add_flag("--qr", o->qr, "Show address, name and password as a QR code, too");
            c.add_flag("--renew", o->renew, "Give a device that is there another password");
        },
        [&context, o] { addDevice(context, *o); });
    addCommand(*device, context, "remove", "Take a device's password away; it is refused at once", named,
               [&context, o] { removeDevice(context, *o); });
    addBooksLinkCommands(*books, context);
}

} // namespace rolvane::cli
