#include "Context.h"
#include "RecordJson.h"
#include "Texts.h"
#include "ValueNames.h"

#include "foundation/Preferences.h"
#include "foundation/PropertyList.h"

#include <fmt/format.h>

namespace rolvane::cli {

namespace {

struct DefaultsOptions {
    std::string domain = kDaemonDomain, key, value, type = "string";
};

void read(Context& context, const DefaultsOptions& options) {
    Preferences& preferences = Preferences::shared();
    if (!options.key.empty()) {
        const Value value = preferences.get(options.domain, options.key);
        if (value.isAbsent())
            throw CommandError(kNotFound, tr("There is no {} in the domain {}.", options.key, options.domain));
        return context.json ? context.print(toJson(value)) : context.line(value.description());
    }
    Dictionary all;
    for (const std::string& key : preferences.keys(options.domain)) all.set(key, preferences.get(options.domain, key));
    context.json ? context.print(toJson(Value(all))) : context.line(description(all));
}

Value parsed(const DefaultsOptions& options) {
    const std::string& text = options.value;
    const auto wrong = [&] { return CommandError(kUsage, tr("\"{}\" is not of the type {}.", text, options.type)); };
    if (options.type == "string") return text;
    if (options.type == "plist") return PropertyList::fromXML(text);
    if (options.type == "bool") {
        if (text == "true" || text == "yes" || text == "1") return true;
        if (text == "false" || text == "no" || text == "0") return false;
        throw wrong();
    }
    if (options.type == "date") {
        const auto date = Date::fromISO8601(text);
        if (!date) throw wrong();
        return *date;
    }
    size_t used = 0;
    try {
        const Value number = options.type == "int" ? Value(std::stoll(text, &used)) : Value(std::stod(text, &used));
        if (used == text.size()) return number;
    } catch (const std::exception&) { // stoll and stod say in this way that the text is no number
    }
    throw wrong();
}

void write(Context& context, const DefaultsOptions& options) {
    Preferences& preferences = Preferences::shared();
    preferences.set(options.domain, options.key, parsed(options));
    preferences.synchronize(options.domain);
    context.say(tr("{} is set.", options.key));
}

void remove(Context& context, const DefaultsOptions& options) {
    Preferences& preferences = Preferences::shared();
    if (preferences.get(options.domain, options.key).isAbsent())
        throw CommandError(kNotFound, tr("There is no {} in the domain {}.", options.key, options.domain));
    preferences.remove(options.domain, options.key);
    preferences.synchronize(options.domain);
    context.say(tr("{} is removed.", options.key));
}

} // namespace

void addPreferencesCommands(CLI::App& app, Context& context) {
    CLI::App* defaults = addCommand(app, context, "defaults", "Read and change preferences", nullptr, nullptr);
    defaults->require_subcommand(1);
    const auto o = std::make_shared<DefaultsOptions>();
    const auto domain = [o](CLI::App& c) {
        c.add_option("-d,--domain", o->domain, "The domain; the daemon's is the default")->capture_default_str();
    };
    addCommand(
        *defaults, context, "read", "Show one value, or all of the domain",
        [&](CLI::App& c) {
            domain(c);
            c.add_option("key", o->key, "The key")->type_name(kKeyValue);
        },
        [&context, o] { read(context, *o); });
    addCommand(
        *defaults, context, "write", "Set a value; a running daemon reads most of them when it starts",
        [&](CLI::App& c) {
            domain(c);
            c.add_option("key", o->key, "The key")->required()->type_name(kKeyValue);
            c.add_option("value", o->value, "The value")->required();
            c.add_option("-t,--type", o->type, "string, int, real, bool, date or plist (XML text)")
                ->check(CLI::IsMember({"string", "int", "real", "bool", "date", "plist"}))
                ->capture_default_str();
        },
        [&context, o] { write(context, *o); });
    addCommand(
        *defaults, context, "delete", "Remove a value",
        [&](CLI::App& c) {
            domain(c);
            c.add_option("key", o->key, "The key")->required()->type_name(kKeyValue);
        },
        [&context, o] { remove(context, *o); });
}

} // namespace rolvane::cli
