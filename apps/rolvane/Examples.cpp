#include "Examples.h"

#include "Texts.h"

#include <map>

namespace rolvane::cli {

namespace {

const std::map<std::string, const char*>& examples() {
    static const std::map<std::string, const char*> all{
        {"new-database", "  rolvane new-database && rolvane import contacts.vcf"},
        {"backup", "  rolvane backup contacts.rolvane\n"
                   "  rolvane backup --yes /media/stick/contacts.rolvane"},
        {"restore", "  rolvane restore --dry-run contacts.rolvane\n"
                    "  rolvane restore contacts.rolvane"},
        {"import", "  rolvane import friends.vcf work.vcf\n"
                   "  rolvane import --charset WINDOWS-1252 --dry-run old.vcf\n"
                   "  rolvane import google.csv thunderbird.ldif\n"
                   "  curl https://example.org/team.vcf | rolvane import -"},
        {"export", "  rolvane export -o everybody.vcf\n"
                   "  rolvane export --group Family --vcard 3 > family.vcf"},
        {"list", "  rolvane list miller\n"
                 "  rolvane list --group Family --json --full\n"
                 "  rolvane list --of bob"},
        {"search", "  rolvane search zurich fair\n"
                   "  rolvane search +49 170 1234567"},
        {"help", "  rolvane help group add\n"
                 "  rolvane help exit-codes"},
        {"show", "  rolvane show \"Ada Miller\"\n"
                 "  rolvane show 4CA70A2B --json"},
        {"add", "  rolvane add --first Ada --last Miller --phone \"mobile:+1 555 0100\" --group Family"},
        {"edit", "  rolvane edit \"Ada Miller\" --email work:ada@example.org --note \"\""},
        {"delete", "  rolvane delete \"Ada Miller\" --yes"},
        {"duplicates", "  rolvane duplicates"},
        {"merge", "  rolvane merge \"Ada Miller\" --dry-run\n"
                  "  rolvane merge 4CA70A2B 9D01F3C7\n"
                  "  rolvane merge --alike"},
        {"group create", "  rolvane group create Family \"Ada Miller\" \"Bob Miller\""},
        {"group add", "  rolvane group add Family \"Ada Miller\""},
        {"group remove", "  rolvane group remove Family \"Ada Miller\""},
        {"group add-group", "  rolvane group add-group Family Cousins"},
        {"group rename", "  rolvane group rename Family Kin"},
        {"group choose", "  rolvane group choose Family \"Ada Miller\" Email Home\n"
                         "  rolvane group choose Family \"Ada Miller\" Email --clear"},
        {"setup", "  rolvane setup\n"
                  "  rolvane setup 'rolvane:1:...'\n"
                  "  rolvane setup --here --import friends.vcf --no-input\n"
                  "  rolvane setup --endpoint https://dav.example.org/dav --user ada --keyring"},
        {"doctor", "  rolvane doctor\n"
                   "  rolvane doctor --json\n"
                   "  rolvane doctor --bundle report.json"},
        {"invite", "  rolvane invite bob\n"
                   "  rolvane invite bob --ask-password --qr"},
        {"account set", "  rolvane account set --user ada --endpoint 'https://dav.example.org/dav/{user}/Contacts' \\\n"
                        "      --password-command 'pass show dav.example.org'\n"
                        "  rolvane account set --password-file ~/.config/rolvane/password"},
        {"account test", "  rolvane account test && rolvane publish"},
        {"log", "  rolvane log\n"
                "  rolvane log \"Ada Miller\"\n"
                "  rolvane log \"Ada Miller\" --purge --yes"},
        {"undo", "  rolvane undo\n"
                 "  rolvane undo 12 --dry-run"},
        {"plan", "  rolvane plan\n"
                 "  rolvane plan --json"},
        {"publish", "  rolvane publish\n"
                    "  rolvane publish --dry-run\n"
                    "  rolvane publish --group Family\n"
                    "  rolvane publish --replace"},
        {"unpublish", "  rolvane unpublish --group Family\n"
                      "  rolvane unpublish --keep\n"
                      "  rolvane unpublish --yes --forget-shares\n"
                      "  rolvane unpublish --all-computers"},
        {"share", "  rolvane share bob\n"
                  "  rolvane share carol --write"},
        {"unshare", "  rolvane unshare bob"},
        {"shares", "  rolvane shares --json"},
        {"rights", "  rolvane rights bob"},
        {"who", "  rolvane who \"Ada Miller\""},
        {"preview", "  rolvane preview bob\n"
                    "  rolvane preview bob --json"},
        {"withdrawn list", "  rolvane withdrawn list"},
        {"withdrawn import", "  rolvane withdrawn import bob"},
        {"conflicts list", "  rolvane conflicts list"},
        {"conflicts restore", "  rolvane conflicts restore 3"},
        {"subscribe", "  rolvane subscribe bob\n"
                      "  rolvane subscribe http://dav.example.org/bob/Contacts --no-wait"},
        {"unsubscribe", "  rolvane unsubscribe bob"},
        {"join", "  rolvane join --dry-run\n"
                 "  rolvane join --yes"},
        {"computers", "  rolvane computers\n"
                      "  rolvane computers --name laptop\n"
                      "  rolvane computers --invite --qr"},
        {"leave", "  rolvane leave\n"
                  "  rolvane leave --computer \"old laptop\""},
        {"subscriptions", "  rolvane subscriptions\n"
                          "  rolvane subscriptions --json"},
        {"group list", "  rolvane group list --of bob"},
        {"sync", "  rolvane sync --timeout 60"},
        {"daemon", "  rolvane daemon start\n"
                   "  rolvane daemon status --json"},
        {"status", "  rolvane status --json"},
        {"watch", "  rolvane watch\n"
                  "  rolvane watch --json --once --seconds 60"},
        {"defaults read", "  rolvane defaults read\n"
                          "  rolvane defaults read CXDShareCount"},
        {"defaults write", "  rolvane defaults write CXDDebugLevel 1 --type int"},
        {"store start", "  rolvane store start\n"
                        "  rolvane store start --directory ~/stores/work --port 8443"},
        {"store reload", "  rolvane store reload --system"},
        {"store backup", "  rolvane store backup store.tar.gz\n"
                         "  rolvane store backup --system --keep 14 /var/backups/rolvane-store"},
        {"store restore", "  rolvane store restore store.tar.gz"},
        {"store user quota", "  rolvane store user quota\n"
                             "  rolvane store user quota bob 2G --system"},
        {"books on", "  rolvane books on && rolvane books device add laptop\n"
                     "  rolvane books on --listen 192.168.1.20"},
        {"books device add", "  rolvane books device add laptop\n"
                             "  rolvane books device add phone --qr"},
        {"books link",
         "  rolvane books link https://cloud.example.org/remote.php/dav/addressbooks/users/ada/contacts/ \\\n"
         "      --user ada --password-command 'pass show cloud.example.org'"},
        {"books device remove", "  rolvane books device remove phone"},
        {"store user remove", "  rolvane store user remove bob --yes"},
        {"store user add", "  rolvane store user add alice\n"
                           "  rolvane store user add bob --invite"},
    };
    return all;
}

} // namespace

std::string exampleOf(const std::string& path) {
    const auto found = examples().find(path);
    return found == examples().end() ? "" : found->second;
}

std::string helpFooter(const std::string& path) {
    const std::string lines = exampleOf(path), codes = translated("`rolvane --help` lists the exit codes.");
    return lines.empty() ? codes : translated("Examples:") + ("\n" + lines) + "\n\n" + codes;
}

} // namespace rolvane::cli
