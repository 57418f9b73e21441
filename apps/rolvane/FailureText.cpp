#include "FailureText.h"

#include "AskAgain.h"
#include "Texts.h"

#include "engine/pass/StoreFailures.h"
#include "store/dav/CXDAVManager.h"

#include <fmt/format.h>

namespace rolvane::cli {

namespace {

const char* byItself() {
    return translated("The daemon tries again by itself.");
}

std::string quoted(const std::string& words) {
    return words.empty() ? std::string() : " (\"" + words + "\")";
}

std::string nameOf(const FailureScene& scene) {
    return scene.store.empty() ? translated("the store") : scene.store;
}

std::string until(const PassFailure& failure, const FailureScene& scene) {
    if (!failure.retryAfterSeconds) return byItself();
    return tr("It wants to be asked again at {}; the daemon does so by itself.",
              shownDate(scene.at.addingSeconds(*failure.retryAfterSeconds)));
}

FailureText password(const FailureScene& scene, const std::string& words) {
    return {
        kRefused, tr("{} refused the user name or the password of \"{}\"{}.", nameOf(scene), scene.self, quoted(words)),
        translated(
            "If the password was changed there, type `rolvane account set --ask-password`: the daemon then goes on by "
            "itself.")};
}

// Without an answer that can be believed.
FailureText unanswered(const PassFailure& failure, const FailureScene& scene) {
    const std::string store = nameOf(scene);
    const std::string asked = failure.method.empty() ? "" : tr(" (asked for {})", failure.method);
    switch (failure.error) {
    case kCXDAVErrorTimedOut: return {kUnreachable, tr("{} did not answer in time{}.", store, asked), byItself()};
    case kCXDAVErrorSecureConnection:
        return {
            kUnreachable, tr("There is no secure connection to {}{}.", store, quoted(failure.words)),
            translated(
                "Check the account's authority, with `rolvane account set --ca-file FILE`, and the host's name in the "
                "endpoint. Nothing was sent.")};
    case kCXDAVErrorBadServerResponse:
        return {kUnreachable,
                tr("Whoever answers for {} is no WebDAV server{}{}.", store, asked, quoted(failure.words)),
                translated("Where the network has a page to sign in, sign in there; else check the account's endpoint. "
                           "`rolvane account show` tells it.")};
    case kCXDAVErrorAuthentication: return password(scene, failure.words);
    case kCXDAVErrorNoPassword:
        return {kRefused, tr("The password of \"{}\" cannot be had{}.", scene.self, quoted(failure.words)),
                translated("`rolvane account test` says why, `rolvane account set --ask-password` takes it anew.")};
    case kCXDAVErrorNoAccount:
        return {kNotFound, translated("There is no account on a store."),
                translated("`rolvane account set` makes one.")};
    case kCXDAVErrorCannotConnect: {
        const bool unknownName = failure.words.find("resolve") != std::string::npos;
        return {kUnreachable, tr("{} cannot be reached{}.", store, quoted(failure.words)),
                unknownName
                    ? translated("Is this machine on the network? If it is, check the host's name in the account's "
                                 "endpoint: `rolvane account show` tells it.")
                    : translated("Look whether it runs, and whether this machine is on the network. ") +
                          std::string(byItself())};
    }
    default: return {kUnreachable, tr("{} could not be used{}.", store, quoted(failure.words)), byItself()};
    }
}

FailureText forbidden(const PassFailure& failure, const FailureScene& scene) {
    const std::string what = tr("The store does not allow {} (403){}.", failure.method, quoted(failure.words));
    if (scene.user.empty())
        return {kRefused, what, translated("Have the store's administrator let you use your own tree.")};
    return {kRefused, what,
            tr("Ask {} for `rolvane share {}{}`.", scene.user, scene.self, scene.reads ? "" : " --write")};
}

} // namespace

FailureText failureText(const PassFailure& failure, const FailureScene& scene) {
    if (failure.status == 0) return unanswered(failure, scene);
    if (failure.status == 401) return password(scene, failure.words);
    if (failure.status == 403) return forbidden(failure, scene);
    // A page of somebody else's, whatever its status.
    const bool isBusy = failure.status >= 500 || failure.status == 408 || failure.status == 429;
    if (failure.error == kCXDAVErrorBadServerResponse && !isBusy) return unanswered(failure, scene);
    const auto answered = [&](const char* meaning) {
        return tr("The store answered {} with {}{}{}.", failure.method, failure.status, meaning, quoted(failure.words));
    };
    switch (failure.status) {
    case 404:
    case 409:
        return {
            kFailed, answered(translated(": the folder above is missing there")),
            translated(
                "The next pass makes the tree whole. If it is told again, check the account's endpoint, and have the "
                "store's administrator look at the folder.")};
    case 405:
    case 501:
        return {kFailed, answered(translated(": it does not know this there")),
                translated("Check the account's endpoint: WebDAV has to be switched on for the whole tree.")};
    case 408: return {kUnreachable, answered(translated(": it waited too long")), byItself()};
    case 412:
        return {kFailed, answered(translated(": somebody else has changed the same at this moment")),
                translated("The next pass looks at both and tries again.")};
    case 413:
        return {kFailed, answered(translated(": that is too large for it")),
                translated("Have its administrator allow larger files, or make the contact's photo smaller.")};
    case 423:
        return {kFailed, answered(translated(": somebody else holds the lock of the tree")),
                translated("The daemon tries again by itself; a lock that nobody gives back ends after five minutes.")};
    case 429:
    case 503: return {kUnreachable, answered(translated(": it is too busy")), until(failure, scene)};
    case 507:
        return {kFailed, answered(translated(": it has no room left")),
                translated("Make room there, or have the quota raised; the daemon tries again by itself.")};
    default: break;
    }
    if (failure.status >= 500)
        return {
            kUnreachable, answered(translated(": it has failed")),
            translated(
                "The daemon tries again by itself. If it goes on, the store's administrator finds the reason in its "
                "log.")};
    return {kFailed, answered(""), byItself()};
}

CommandError noAccount() {
    return {kNotFound, translated("There is no account on a store yet. `rolvane setup` makes one.")};
}

FailureScene sceneOfTheAccount(Date at) {
    const CXDAVAccount& account = CXDAVManager::defaultManager().account();
    const std::vector<std::string> origins = account.user.empty() ? std::vector<std::string>() : account.origins();
    return {origins.empty() ? std::string() : origins.front(), account.user.str(), {}, false, at};
}

std::optional<PassFailure> testStore() {
    CXDAVManager& store = CXDAVManager::defaultManager();
    CXDAVError error;
    (void)takeFailures(store);
    if (store.canReach(error)) return std::nullopt;
    const std::vector<PassFailure> requests = takeFailures(store);
    PassFailure failure = requests.empty() ? PassFailure{{}, {}, 0, 0, error.reason, std::nullopt} : requests.back();
    failure.error = error.code;
    return failure;
}

void requireStore(Context& context, const std::string& nothingDone) {
    AskAgain again(context);
    auto failure = testStore();
    while (failure && again.after(*failure)) failure = testStore();
    if (!failure) return;
    const FailureText text = failureText(*failure, sceneOfTheAccount(Clock::system().now()));
    throw CommandError(text.code, text.what + " " + text.toDo + " " + nothingDone);
}

CommandError hinderedBy(const StoreTrial::Hindrance& hindrance, const std::string& consequence) {
    using Remedy = StoreTrial::Hindrance::Remedy;
    const auto toDo = [&] {
        switch (hindrance.remedy) {
        case Remedy::rights: return translated("Have the store's administrator let you use your own tree.");
        case Remedy::locks:
            return translated("Have the server's locks turned off (it announces no class 2 then), or mended.");
        case Remedy::endpoint: break;
        }
        return translated(
            "Check the account's endpoint: it has to be a WebDAV folder for files of every kind. Servers for "
            "address "
            "books or calendars alone take none.");
    };
    const ExitCode code = hindrance.remedy == Remedy::rights ? kRefused
                          : hindrance.status == 0            ? kUnreachable
                                                             : kFailed;
    return {code, hindrance.what + " " + consequence + " " + toDo()};
}

void requireUsableStore(const std::string& nothingDone) {
    const StoreTrial trial = tryStore(CXDAVManager::defaultManager());
    if (trial.hindrance && trial.hindrance->lasts) throw hinderedBy(*trial.hindrance, nothingDone);
}

nlohmann::ordered_json failureJson(const PassFailure& failure, const FailureScene& scene) {
    using Json = nlohmann::ordered_json;
    const FailureText text = failureText(failure, scene);
    return {{"method", failure.method.empty() ? Json() : Json(failure.method)},
            {"url", failure.url.empty() ? Json() : Json(failure.url)},
            {"status", failure.status == 0 ? Json() : Json(failure.status)},
            {"words", failure.words},
            {"retryAfter", failure.retryAfterSeconds ? Json(*failure.retryAfterSeconds) : Json()},
            {"what", text.what},
            {"toDo", text.toDo}};
}

} // namespace rolvane::cli
