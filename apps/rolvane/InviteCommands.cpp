#include "Invite.h"

#include "FailureText.h"
#include "QrCode.h"
#include "SetupCommands.h"
#include "Terminal.h"
#include "Texts.h"

#include "foundation/Paths.h"
#include "store/account/Account.h"
#include "store/account/CertificateChain.h"
#include "store/dav/CXDAVManager.h"

#include <algorithm>
#include <fmt/format.h>
#include <iostream>

namespace rolvane::cli {

namespace {

struct InviteOptions {
    std::string user;
    bool askPassword = false, qr = false;
};

// The authority that the account believes, as far as the store shows it; "" where the system's authorities do.
std::string authorityFingerprint(const CXDAVAccount& account) {
    if (account.caFile.empty()) return {};
    const auto believed = certificatesIn(readFile(account.caFile));
    for (const ShownCertificate& shown : certificatesShownAt(Url(account.origins().back() + "/")))
        if (withFingerprint(believed, shown.fingerprint)) return shown.fingerprint;
    throw CommandError(kFailed, tr("The store at {} does not show the certificate of its authority, so no "
                                   "invitation can name it. Have the server send its whole chain, or give the "
                                   "other person the file {}.",
                                   account.origins().back(), account.caFile));
}

Invitation invitationTo(const CXDAVAccount& account, const std::string& user) {
    Invitation invitation;
    invitation.endpoint = account.secureEndpoint.empty() ? account.endpoint : account.secureEndpoint;
    invitation.user = user;
    invitation.fingerprint = authorityFingerprint(account);
    return invitation;
}

void printLine(Context& context, const Invitation& invitation, bool qr) {
    const std::string line = invitation.line();
    if (context.json)
        return context.print({{"user", invitation.user},
                              {"endpoint", invitation.endpoint},
                              {"fingerprint", invitation.fingerprint},
                              {"holdsPassword", !invitation.password.empty()},
                              {"invitation", line}});
    context.line(line);
    if (qr) showQrCode(context, line);
}

void invite(Context& context, const InviteOptions& options) {
    const auto account = CXDAVAccount::load();
    if (!account) throw noAccount();
    requireStore(context, translated("Nobody was invited."));
    Invitation invitation = invitationTo(*account, options.user);
    invitation.inviter = account->user.str();
    CXDAVAccount theirs;
    theirs.user = UserName(options.user);
    theirs.endpoint = invitation.endpoint;
    if (const auto problem = theirs.problem()) throw CommandError(kUsage, *problem);
    if (options.askPassword) invitation.password = readSecret(tr("First password of {}: ", options.user));
    if (options.askPassword && invitation.password.empty())
        throw CommandError(kUsage, translated("The password is empty. Nobody was invited."));
    printInvitation(context, invitation, options.qr);
}

} // namespace

std::string inviterOn(const std::string& endpoint) {
    try {
        const auto account = CXDAVAccount::load();
        if (account && (account->endpoint == endpoint || account->secureEndpoint == endpoint))
            return account->user.str();
    } catch (const CXException&) {
        return {}; // an account that cannot be used invites nobody
    }
    return {};
}

void printInvitation(Context& context, const Invitation& invitation, bool qr) {
    printLine(context, invitation, qr);
    if (context.json) return;
    context.say(tr("`rolvane setup 'LINE'` with this line, typed by {}, sets everything up.", invitation.user));
    if (invitation.password.empty())
        context.say(translated("It holds no password: setup asks for it."));
    else if (invitation.passwordPath.empty())
        context.say(translated("Whoever reads it can sign in: send it so that nobody else does."));
    else
        context.say(
            translated("Whoever uses it first has the account, and then the line is of no more use: send it so that "
                       "nobody else reads it."));
}

void inviteOwnComputer(Context& context, bool qr) {
    const auto account = CXDAVAccount::load();
    if (!account) throw noAccount();
    requireStore(context, translated("No line was made."));
    Invitation invitation = invitationTo(*account, account->user.str());
    invitation.password = account->password();
    printLine(context, invitation, qr);
    if (context.json) return;
    if (!invitation.password.empty())
        context.warn(
            translated("The line holds your password: whoever reads it can sign in as you. Let nobody else see "
                       "it, and keep it nowhere."));
    context.say(translated("On the other computer: `rolvane setup 'LINE'` with this line, then `rolvane join`."));
}

void addInviteCommands(CLI::App& app, Context& context) {
    const auto o = std::make_shared<InviteOptions>();
    addCommand(
        app, context, "invite", "Print a line that sets up somebody else's account on your store",
        [&](CLI::App& c) {
            c.add_option("user", o->user, "The other person's user name on the store")->required();
            c.add_flag(
                "--ask-password", o->askPassword,
                "Ask for that user's first password (or read a line of standard input) and put it into the line");
            c.add_flag("--qr", o->qr, "Show the line as a QR code, too");
        },
        [&context, o] { invite(context, *o); });
}

} // namespace rolvane::cli
