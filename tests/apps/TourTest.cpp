#include "CommandWorld.h"
#include "TerminalSession.h"

#include "foundation/Paths.h"

#include <filesystem>
#include <regex>
#include <sstream>
#include <unistd.h>

namespace rolvane::test {
namespace {

namespace fs = std::filesystem;

struct Step {
    std::string user, command;
    std::vector<std::string> expected;
};

std::vector<std::string> linesOf(const std::string& text) {
    std::vector<std::string> lines;
    std::istringstream stream(text);
    for (std::string line; std::getline(stream, line);) lines.push_back(line);
    return lines;
}

// The commands of README's tour, in their order, with what is shown for each.
std::vector<Step> tour() {
    std::vector<Step> steps;
    bool inTour = false, inBlock = false;
    for (const std::string& line : linesOf(contentsOf(ROLVANE_SOURCE_DIR "/README.md"))) {
        if (line.starts_with("## ")) inTour = line == "## A minute's tour";
        const bool isBlock = inTour && line.starts_with("    ");
        const std::string text = isBlock ? line.substr(4) : "";
        std::smatch found;
        static const std::regex prompt("^([a-z]*)\\$ (.*)$");
        if (isBlock && std::regex_match(text, found, prompt)) {
            steps.push_back({found[1].length() ? found[1].str() : "alice", found[2], {}});
            inBlock = true;
        } else if (isBlock && inBlock) {
            steps.back().expected.push_back(text);
        } else {
            inBlock = false;
        }
    }
    return steps;
}

// Without what differs from one tour to the next, and without progress bars.
std::vector<std::string> comparable(const std::vector<std::string>& lines, const std::string& home) {
    static const std::pair<std::regex, const char*> kVarying[] = {
        {std::regex("process \\d+"), "process N"},
        {std::regex("localhost:\\d+"), "localhost:N"},
        {std::regex("\\d{4}-\\d\\d-\\d\\d [0-9]{2}:[0-9:]+"), "DATE"},
        {std::regex("rolvane:1:[A-Za-z0-9_.-]+"), "LINE"},
        {std::regex("\\s+$"), ""},
    };
    static const std::regex bar("^[A-Z][a-z]+ \\[[# ]*\\].*");
    std::vector<std::string> out;
    for (std::string line : lines) {
        for (size_t at; (at = line.find(home)) != std::string::npos;) line.replace(at, home.size(), "/home/alice");
        for (const auto& [pattern, text] : kVarying) line = std::regex_replace(line, pattern, text);
        if (!std::regex_match(line, bar)) out.push_back(line);
    }
    return out;
}

// "..." stands for any lines.
bool matches(const std::vector<std::string>& expected, const std::vector<std::string>& found, size_t e = 0,
             size_t f = 0) {
    for (; e < expected.size(); ++e, ++f) {
        if (expected[e] == "...") {
            for (size_t skipped = f; skipped <= found.size(); ++skipped)
                if (matches(expected, found, e + 1, skipped)) return true;
            return false;
        }
        if (f >= found.size() || expected[e] != found[f]) return false;
    }
    return f == found.size();
}

// Two users of this machine: two accounts of the system where the test may have them, else two homes.
class Tour : public testing::Test {
protected:
    Tour() {
        fs::permissions(directory.path(), fs::perms(0755));
        install(UserWorld::rolvaneProgram(), "bin/rolvane");
        install(UserWorld::managerProgram(), "bin/RolvaneManager");
        install(ROLVANE_MODULE, "lib/apache2/modules/mod_davacl.so");
        install(ROLVANE_SOURCE_DIR "/server/httpd.conf.in", "share/rolvane/httpd.conf.in");
        install(ROLVANE_SOURCE_DIR "/share/demo/people.vcf", "share/demo/people.vcf");
        for (const char* user : {"alice", "bob"}) {
            fs::create_directory(home(user));
            fs::permissions(home(user), fs::perms::owner_all);
            if (::geteuid() == 0 && ::chown(home(user).c_str(), number(user), number(user)) != 0)
                ADD_FAILURE() << "no home for " << user;
        }
    }
    ~Tour() override {
        for (const char* user : {"alice", "bob"})
            for (const char* command : {"rolvane daemon stop", "rolvane store stop --now"}) {
                TerminalSession session(shellLine(user, command), environment(user));
                (void)session.end();
            }
    }
    void install(const std::string& from, const std::string& to) {
        const std::string path = directory / to;
        fs::create_directories(fs::path(path).parent_path());
        fs::copy_file(from, path);
        fs::permissions(path, fs::perms(0755));
        for (fs::path up = fs::path(path).parent_path(); up != directory.path(); up = up.parent_path())
            fs::permissions(up, fs::perms(0755));
    }
    static uid_t number(const std::string& user) { return user == "alice" ? 61001 : 61002; }
    std::string home(const std::string& user) const { return directory / user; }
    std::vector<std::string> environment(const std::string& user) const {
        return {"HOME=" + home(user), "PATH=" + (directory / "bin") + ":/usr/bin:/bin:/usr/sbin:/sbin", "LANG=C.UTF-8",
                "TERM=dumb", "SHELL=/bin/sh"};
    }
    std::string shellLine(const std::string& user, const std::string& command) const {
        const std::string line = "cd " + quotedForShell(directory.path()) + " && " + command;
        if (::geteuid() != 0) return line;
        const std::string id = std::to_string(number(user));
        return "setpriv --reuid=" + id + " --regid=" + id + " --clear-groups /bin/sh -c " + quotedForShell(line);
    }
    TempDirectory directory;
};

TEST_F(Tour, OfTheReadmePrintsWhatTheReadmeShows) {
    const std::vector<Step> steps = tour();
    ASSERT_GE(steps.size(), 14U) << "the README's tour";
    if (::geteuid() == 0) {
        TerminalSession look(shellLine("bob", "ls " + home("alice")), environment("bob"));
        EXPECT_NE(look.end(), 0) << "they are strangers to each other";
    }
    std::string invitation;
    for (const Step& step : steps) {
        std::string command = step.command;
        if (const size_t at = command.find("rolvane:1:"); at != std::string::npos)
            command.replace(at, command.find('\'', at) - at, invitation);
        TerminalSession session(shellLine(step.user, command), environment(step.user));
        ASSERT_EQ(session.end(), kDone) << step.user << "$ " << command << "\n" << session.shown();
        const std::string shown = session.shown();
        if (const size_t at = shown.find("rolvane:1:"); at != std::string::npos)
            invitation = shown.substr(at, shown.find('\n', at) - at);
        const auto expected = comparable(step.expected, "/home/alice");
        const auto found = comparable(linesOf(shown), home("alice"));
        EXPECT_TRUE(matches(expected, found)) << step.user << "$ " << step.command << "\nshown:\n"
                                              << shown << "README:\n"
                                              << testing::PrintToString(expected);
    }
}

} // namespace
} // namespace rolvane::test
