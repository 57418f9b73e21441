#pragma once

#include "Context.h"
#include "FailureText.h"
#include "PendingPassword.h"
#include "PublishedAlready.h"
#include "Questions.h"

#include "engine/pass/PassOutcome.h"
#include "store/account/Account.h"
#include "store/account/Invitation.h"
#include "store/account/StoreTrial.h"

#include <optional>
#include <string>
#include <vector>

namespace rolvane::cli {

// The options of `rolvane setup`; each one answers one of its questions.
struct SetupOptions {
    std::string invitation, endpoint, user, caFile, fingerprint;
    std::string passwordCommand, passwordCredential, passwordFile;
    bool here = false, keyring = false, askPassword = false, noPassword = false;
    bool noInput = false, replace = false;
    std::optional<bool> subscribes;
    std::vector<std::string> imports;
};

// One run of `rolvane setup`: finds out about the store, tries the account with all that a publication needs, and only
// then saves it. A failure leaves the former account as it was; a store and its user that were made for it stay. Where
// the password has been changed on the store it waits in a file, and the same command goes on from there.
class Setup {
public:
    Setup(Context& context, SetupOptions options);
    void run(); // throws CommandError

private:
    void chooseStore();
    void chooseUser();
    void takeInvitation(const std::string& line);
    void useStoreHere();
    void respectFormerAccount();

    void trustAuthority();
    void pin(const std::string& fingerprint);
    void askToTrust(const FailureText& why);
    std::optional<PassFailure> reach(const PasswordSource& source);

    enum class Keep { source, file, keyring };
    void choosePassword();
    void signIn();
    bool signsIn(const std::string& password);
    void signInInvited();
    void makeOwnPassword();
    std::string typedPassword();

    void tryStoreOut();
    void keep();
    void tell();
    void importContacts();
    void subscribeToInviter();

    [[noreturn]] void failWith(const PassFailure& failure) const;

    Context& _context;
    SetupOptions _options;
    Questions _questions;
    CXDAVAccount _account;
    std::optional<CXDAVAccount> _former;
    std::optional<Invitation> _invitation;
    std::optional<PendingPassword> _pending;
    Keep _keep = Keep::source;
    std::string _password; // where it is kept by setup
    bool _wasTried = true;
    StoreTrial _trial;
    PublishedAlready _published;
};

} // namespace rolvane::cli
