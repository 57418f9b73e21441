#include "AccountTrial.h"
#include "Texts.h"

#include "daemon/DaemonControl.h"
#include "daemon/RetrySchedule.h"
#include "foundation/Paths.h"
#include "foundation/Preferences.h"
#include "store/account/SecretService.h"

#include <filesystem>

namespace rolvane::cli {

namespace {

// The last pass has ended for that, and the daemon with it: nothing else would start it.
bool passwordWasRefused() {
    try {
        const auto outcome = lastOutcome(Preferences::shared());
        return outcome && resultOf(*outcome).passwordRefused;
    } catch (const CXException&) {
        return false; // damaged preferences are told by whoever needs them
    }
}

} // namespace

void requirePassword(const CXDAVAccount& account) {
    try {
        (void)account.password();
    } catch (const CXException& error) {
        throw CommandError(kRefused, error.reason());
    }
}

std::vector<std::string> consequences(const StoreTrial& trial) {
    std::vector<std::string> lines;
    if (!trial.locks && trial.conditions)
        lines.emplace_back(
            translated("It keeps no locks: of two who change one file at once the second is told, and tries again."));
    if (!trial.locks && !trial.conditions)
        lines.emplace_back(
            translated("It keeps no locks and heeds no conditions: of two who change one file at once the later one "
                       "wins. Publish from one machine at a time."));
    if (!trial.dates && trial.tags)
        lines.emplace_back(translated("Its listings tell no dates: versions are told by their tags."));
    if (trial.dates && !trial.tags)
        lines.emplace_back(translated("Its listings tell no tags: versions are told by date and size."));
    if (!trial.dates && !trial.tags)
        lines.emplace_back(translated("Its listings tell neither dates nor tags: every pass reads everything."));
    if (!trial.accessLists)
        lines.emplace_back(
            translated("It keeps no access lists: who may read is the store's own matter, and `rolvane share` cannot "
                       "change it."));
    return lines;
}

nlohmann::ordered_json trialJson(const StoreTrial& trial) {
    return {{"usable", !trial.hindrance},
            {"hindrance", trial.hindrance ? nlohmann::ordered_json(trial.hindrance->what) : nlohmann::ordered_json()},
            {"dates", trial.dates},
            {"tags", trial.tags},
            {"locks", trial.locks},
            {"conditions", trial.conditions},
            {"accessLists", trial.accessLists}};
}

std::string absolutePath(const std::string& path) {
    return path.empty() ? path : std::filesystem::absolute(path).lexically_normal().string();
}

void accountWasSaved(Context& context) {
    if (const DaemonControl daemon; daemon.running()) {
        daemon.restart(); // it reads the account once
        context.say(translated("RolvaneManager was started anew with it."));
    } else if (passwordWasRefused()) {
        daemon.start();
        context.say(
            translated("RolvaneManager, which had ended because the password was refused, runs again and goes on."));
    }
}

PasswordSource keptInFile(const std::string& password) {
    const std::string path = configDirectory() + "/password";
    writeFileDurably(path, password + "\n", 0600);
    return {PasswordSource::Kind::file, path};
}

std::string keyringName(const CXDAVAccount& account) {
    const std::vector<std::string> origins = account.origins();
    return account.user.str() + "@" + (origins.empty() ? std::string() : origins.back());
}

PasswordSource keptInKeyring(const CXDAVAccount& account, const std::string& password) {
    const std::string name = keyringName(account);
    storeSecretInService(name, "Rolvane: " + name, password);
    return {PasswordSource::Kind::keyring, name};
}

} // namespace rolvane::cli
