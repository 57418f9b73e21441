#include "Setup.h"

#include "AccountTrial.h"
#include "ImportReport.h"
#include "Publication.h"
#include "Subscribe.h"
#include "Subscriptions.h"
#include "Texts.h"

#include "foundation/Paths.h"
#include "foundation/Preferences.h"
#include "server/PrivateStore.h"
#include "store/account/CertificateChain.h"
#include "store/account/PasswordChange.h"
#include "store/account/SecretService.h"

#include <algorithm>
#include <fmt/format.h>
#include <memory>

namespace rolvane::cli {

namespace {

using Json = nlohmann::ordered_json;

const char* nothingSaved() {
    return translated("Nothing was saved.");
}

constexpr int kAttempts = 3; // to type a password

// An address as people have it, made an endpoint.
std::string endpointOf(std::string address) {
    if (address.find("://") == std::string::npos) address = "https://" + address;
    while (address.ends_with('/')) address.pop_back();
    if (address.find("{user}") == std::string::npos) address += "/{user}/Contacts";
    return address;
}

bool isOfOnePassword(const PassFailure& failure) {
    return failure.error == kCXDAVErrorAuthentication || failure.status == 401;
}

} // namespace

Setup::Setup(Context& context, SetupOptions options)
    : _context(context), _options(std::move(options)), _questions(context, !_options.noInput) {}

void Setup::run() {
    chooseStore();
    chooseUser();
    if (const auto problem = _account.problem()) throw CommandError(kUsage, *problem + " " + nothingSaved());
    respectFormerAccount();
    if (_options.here) useStoreHere();
    trustAuthority();
    choosePassword();
    signIn();
    tryStoreOut();
    keep();
    tell();
    importContacts();
    subscribeToInviter();
}

// The store ----------------------------------------------------------------------------------------------------------

void Setup::chooseStore() {
    const bool given = !_options.invitation.empty() || !_options.endpoint.empty() || _options.here;
    if (!given) {
        if (!_questions.mayAsk())
            throw CommandError(
                kUsage, translated("Say which store: the line of an invitation, --endpoint ADDRESS, or --here for "
                                   "a store on this machine. Nothing was saved."));
        switch (_questions.choice(translated("Where is the store that your contacts go to?"),
                                  {translated("I have an invitation: a line that begins with rolvane:"),
                                   translated("I know its address (any WebDAV server)"),
                                   translated("On this machine: make one here")},
                                  0)) {
        case 0: _options.invitation = _questions.text(translated("The invitation's line")); break;
        case 1:
            _options.endpoint =
                _questions.text(translated("Its address, such as https://dav.example.org/dav/{user}/Contacts"));
            break;
        default: _options.here = true; break;
        }
    }
    if (!_options.invitation.empty()) return takeInvitation(_options.invitation);
    if (_options.here) {
        const auto known = PrivateStore::savedOptions();
        const bool wasStarted = known && PrivateStore(*known).status().port != 0;
        _account.endpoint = wasStarted ? PrivateStore(*known).endpointTemplate()
                                       : "https://localhost/dav/{user}/Contacts"; // until it has chosen a port
        return;
    }
    if (_options.endpoint.empty()) throw CommandError(kUsage, translated("The address is empty. Nothing was saved."));
    _account.endpoint = endpointOf(_options.endpoint);
    if (_account.endpoint != _options.endpoint) _context.say(tr("The address is taken as {}.", _account.endpoint));
}

void Setup::takeInvitation(const std::string& line) {
    try {
        _invitation = Invitation::fromLine(line);
    } catch (const CXException& error) {
        throw CommandError(kUsage, error.reason() + " " + nothingSaved());
    }
    _account.endpoint = _invitation->endpoint;
    _account.user = UserName(_invitation->user);
}

void Setup::chooseUser() {
    if (_invitation) return;
    std::string user = _options.user;
    if (user.empty() && _options.here) user = _questions.text(translated("Your user name on it"), loginUserName());
    if (user.empty())
        user = _questions.text(translated("Your user name there"), _questions.mayAsk() ? loginUserName() : "");
    if (user.empty()) throw CommandError(kUsage, translated("Name the user with --user. Nothing was saved."));
    _account.user = UserName(user);
}

void Setup::useStoreHere() {
    PrivateStore store(PrivateStore::savedOptions().value_or(PrivateStoreOptions()));
    store.start();
    _account.endpoint = store.endpointTemplate();
    _account.caFile = store.caFile();
    const std::vector<std::string> users = store.users();
    const std::string user = _account.user.str();
    _context.say(tr("A store runs on this machine, at {}.", _account.endpoint));
    if (std::find(users.begin(), users.end(), user) != users.end()) return;
    _password = makePassword();
    store.addUser(user, _password);
    _context.say(tr("{} is a user of it now.", user));
}

void Setup::respectFormerAccount() {
    std::string held;
    try {
        _former = CXDAVAccount::load();
        if (!_former) return;
        const bool isSame = _former->user == _account.user && _former->endpoint == _account.endpoint;
        if (isSame) return;
        held = tr("The account of {} at {} is set up here already.", _former->user.str(), _former->endpoint);
    } catch (const CXException& error) {
        held = error.reason();
    }
    _former.reset();
    if (_options.replace || _questions.yes(held + translated(" Replace it?"), false)) return;
    throw CommandError(kRefused, held + translated(" `--replace` puts the new one in its place. Nothing was changed."));
}

// The authority ------------------------------------------------------------------------------------------------------

std::optional<PassFailure> Setup::reach(const PasswordSource& source) {
    CXDAVAccount account = _account;
    account.passwordSource = source;
    CXDAVManager::setDefaultManager(std::make_shared<CXDAVManager>(account));
    return testStore();
}

void Setup::failWith(const PassFailure& failure) const {
    const FailureText text = failureText(failure, sceneOfTheAccount(Clock::system().now()));
    throw CommandError(text.code, text.what + " " + text.toDo + " " + nothingSaved());
}

void Setup::trustAuthority() {
    if (!_options.caFile.empty()) _account.caFile = absolutePath(_options.caFile);
    if (const auto problem = _account.problem()) throw CommandError(kUsage, *problem + " " + nothingSaved());
    const std::string named = !_options.fingerprint.empty() ? _options.fingerprint
                              : _invitation                 ? _invitation->fingerprint
                                                            : std::string();
    if (!named.empty()) pin(named);
    const auto failure = reach({}); // without a password
    if (!failure || isOfOnePassword(*failure)) return;
    if (failure->error != kCXDAVErrorSecureConnection || !_account.caFile.empty()) failWith(*failure);
    const FailureText text = failureText(*failure, sceneOfTheAccount(Clock::system().now()));
    askToTrust(
        {text.code,
         text.what + translated(" Give the authority with --ca-file FILE or --fingerprint SHA-256. ") + nothingSaved(),
         {}});
    if (const auto still = reach({}); still && !isOfOnePassword(*still)) failWith(*still);
}

// Only the certificate with this fingerprint is believed from now on.
void Setup::pin(const std::string& fingerprint) {
    const auto wanted = normalFingerprint(fingerprint);
    if (!wanted)
        throw CommandError(kUsage, tr("The fingerprint \"{}\" is no SHA-256 in hexadecimal digits. ", fingerprint) +
                                       nothingSaved());
    std::vector<ShownCertificate> chain;
    const Url store(_account.origins().back() + "/");
    try {
        chain = certificatesShownAt(store);
    } catch (const CXException& error) {
        throw CommandError(kUnreachable, error.reason() + " " + nothingSaved());
    }
    const ShownCertificate* found = withFingerprint(chain, *wanted);
    if (!found)
        throw CommandError(kRefused, tr("The store at {} does not show the authority with the fingerprint {}. Somebody "
                                        "may stand between you and it, or it has another authority by now. No password "
                                        "was sent, and nothing was saved. Ask the store's owner for a new invitation.",
                                        store.origin(), *wanted));
    std::string name;
    for (const char c : wanted->substr(0, 23))
        if (c != ':') name += c;
    _account.caFile = configDirectory() + "/authority-" + name + ".pem";
    writeFileDurably(_account.caFile, found->pem, 0600);
}

void Setup::askToTrust(const FailureText& why) {
    if (!_questions.mayAsk()) throw CommandError(why.code, why.what);
    const auto chain = certificatesShownAt(Url(_account.origins().back() + "/"));
    const ShownCertificate* authority = authorityOf(chain);
    _context.warn(tr("This machine does not know the authority of the store's certificate, \"{}\".\nIts "
                     "SHA-256 fingerprint is\n  {}\nCompare it with the one that the store's owner tells you.",
                     authority->subject, authority->fingerprint));
    if (!_questions.yes(translated("Are they the same?"), false)) throw CommandError(why.code, why.what);
    pin(authority->fingerprint);
}

// The password -------------------------------------------------------------------------------------------------------

void Setup::choosePassword() {
    using Kind = PasswordSource::Kind;
    PasswordSource& source = _account.passwordSource;
    const bool isKnown = !_password.empty() || (_invitation && !_invitation->password.empty());
    if (_options.noPassword) return;
    if (!_options.passwordCommand.empty()) source = {Kind::command, _options.passwordCommand};
    if (!_options.passwordCredential.empty()) source = {Kind::credential, _options.passwordCredential};
    if (!_options.passwordFile.empty()) source = {Kind::file, absolutePath(_options.passwordFile)};
    if (source.kind != Kind::none) return;
    if (_options.keyring || _options.askPassword) {
        _keep = _options.keyring ? Keep::keyring : Keep::file;
        return;
    }
    if (!_questions.mayAsk()) {
        if (!isKnown && !_former)
            throw CommandError(kUsage,
                               translated("Say where the password comes from: --keyring or --ask-password with the "
                                          "password on standard input, --password-command, --password-file, "
                                          "--password-credential or --no-password. Nothing was saved."));
        if (!isKnown)
            source = _former->passwordSource;
        else
            _keep = Keep::file;
        return;
    }
    std::vector<std::string> offered{translated("In the keyring of this desktop (secret service)"),
                                     translated("In a file that only you can read")};
    if (!isKnown) {
        offered.emplace_back(translated("Nowhere: a command prints it"));
        offered.emplace_back(translated("Nowhere: the service manager has it as a credential"));
    }
    switch (
        _questions.choice(translated("Where shall the password be kept?"), offered, secretServiceIsOpen() ? 0 : 1)) {
    case 0: _keep = Keep::keyring; break;
    case 1: _keep = Keep::file; break;
    case 2:
        source = {Kind::command, _questions.text(translated("The command; its first line of output is the password"))};
        break;
    default: source = {Kind::credential, _questions.text(translated("The credential's name"))}; break;
    }
}

std::string Setup::typedPassword() {
    return _questions.secret(tr("Password of {}", _account.user.str()));
}

bool Setup::signsIn(const std::string& password) {
    _pending->write(password);
    const auto failure = reach(_pending->source());
    if (!failure) {
        _password = password;
        return true;
    }
    if (!isOfOnePassword(*failure)) failWith(*failure);
    return false;
}

void Setup::signIn() {
    if (_keep == Keep::source) {
        // The service manager gives a credential to the daemon alone.
        _wasTried = _account.passwordSource.kind != PasswordSource::Kind::credential || getenv("CREDENTIALS_DIRECTORY");
        if (!_wasTried) return;
        if (const auto problem = _account.problem()) throw CommandError(kUsage, *problem + " " + nothingSaved());
        requirePassword(_account);
        if (const auto failure = reach(_account.passwordSource)) failWith(*failure);
        return;
    }
    const auto left = PendingPassword::leftFor(_account);
    _pending.emplace(_account);
    if (left) _pending->stay(true); // it may be the only one that counts
    if (left && signsIn(*left)) return;
    if (left) _pending->write(*left);
    if (_invitation && !_invitation->password.empty()) return signInInvited();
    if (!_password.empty()) {
        if (!signsIn(_password)) failWith({"", "", 401, kCXDAVErrorAuthentication, "", std::nullopt});
        return;
    }
    _pending->stay(false);
    for (int attempt = 1;; ++attempt) {
        if (signsIn(typedPassword())) return;
        if (!_questions.mayAsk() || attempt == kAttempts)
            failWith({"", "", 401, kCXDAVErrorAuthentication, "", std::nullopt});
        _context.warn(translated("The store refused the user name or the password. Try again."));
    }
}

void Setup::signInInvited() {
    if (signsIn(_invitation->password)) {
        if (!_invitation->passwordPath.empty()) makeOwnPassword();
        return;
    }
    // The same line again, on the computer that has used it.
    if (_former && !reach(_former->passwordSource)) {
        _keep = Keep::source;
        _account.passwordSource = _former->passwordSource;
        _pending->stay(false);
        return;
    }
    throw CommandError(kRefused, tr("The store refuses the invitation's password: the line works once, and has "
                                    "been used, or a newer one was made. Ask for another one: `rolvane store "
                                    "user add {} --invite --renew`, typed by the store's owner, prints it. "
                                    "Nothing was saved.",
                                    _account.user.str()));
}

// From then on the line is of no use to whoever has read it on its way.
void Setup::makeOwnPassword() {
    const std::string own = makePassword();
    _pending->write(own);
    _pending->stay(true);
    try {
        changePasswordOnStore(CXDAVManager::defaultManager(), _invitation->passwordPath, own);
    } catch (const CXException& error) {
        throw CommandError(kFailed, error.reason() + translated(" Run the same command again: it goes on from here."));
    }
    if (const auto failure = reach(_pending->source())) failWith(*failure);
    _password = own;
}

// The rest -----------------------------------------------------------------------------------------------------------

void Setup::tryStoreOut() {
    if (!_wasTried) return;
    CXDAVManager& store = CXDAVManager::defaultManager();
    const bool publishes = Publication(_context.database()).anything();
    _published = publishedAlready(store, Preferences::shared(), publishes);
    _trial = tryStore(store);
    if (_trial.hindrance) throw hinderedBy(*_trial.hindrance, nothingSaved());
}

void Setup::keep() {
    if (_keep == Keep::keyring) _account.passwordSource = keptInKeyring(_account, _password);
    if (_keep == Keep::file) _account.passwordSource = keptInFile(_password);
    _account.save();
    if (_pending) _pending->remove();
    CXDAVManager::setDefaultManager(nullptr);
    accountWasSaved(_context);
}

void Setup::tell() {
    if (_context.json) {
        _context.print({{"user", _account.user.str()},
                        {"endpoint", _account.endpoint},
                        {"caFile", _account.caFile},
                        {"tried", _wasTried},
                        {"trial", _wasTried ? trialJson(_trial) : Json()},
                        {"published", _wasTried ? publishedAlreadyJson(_published) : Json()},
                        {"inviter", _invitation ? Json(_invitation->inviter) : Json()}});
        _context.json = false; // one document
    }
    if (_wasTried)
        for (const std::string& line : consequences(_trial)) _context.say(line);
    _context.say(_wasTried ? tr("The account of {} at {} is set up, and the store can be used.", _account.user.str(),
                                _account.endpoint)
                           : tr("The account of {} at {} is set up.", _account.user.str(), _account.endpoint));
    if (!_wasTried)
        return _context.say(
            translated("The credential is known to the daemon alone, so nothing was tried. `rolvane status` tells "
                       "how the daemon's passes go."));
    _context.say(publishedAlreadyText(_published));
    if (_published.by == PublishedAlready::By::nobody)
        _context.say(translated("`rolvane publish` publishes your contacts."));
}

void Setup::importContacts() {
    std::vector<std::string> files = _options.imports;
    if (files.empty() && _questions.mayAsk() && _context.database().countPeople(RemoteLocation("")) == 0) {
        const std::string file = _questions.text(
            translated("A file of contacts to import (vCard, CSV or LDIF), or nothing to go on without"));
        if (!file.empty()) files.push_back(file);
    }
    if (!files.empty()) importFiles(_context, files);
}

void Setup::subscribeToInviter() {
    const std::string inviter = _invitation ? _invitation->inviter : std::string();
    if (inviter.empty() || inviter == _account.user.str()) return;
    if (_context.database().findSubscriptionWithRemoteLocation(namedLocation(inviter))) return;
    const bool wanted =
        _options.subscribes
            ? *_options.subscribes
            : _questions.yes(tr("Subscribe to the contacts of \"{}\"?", inviter), true) && _questions.mayAsk();
    if (!wanted) return _context.say(tr("`rolvane subscribe {}` takes what {} shares with you.", inviter, inviter));
    try {
        subscribeTo(_context, inviter);
    } catch (const CommandError& error) { // the account stays
        if (_options.subscribes) throw;
        _context.warn("rolvane: " + error.reason());
    }
}

} // namespace rolvane::cli
