#include "foundation/Paths.h"

#include "foundation/CXException.h"

#include <gtest/gtest.h>

#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <functional>
#include <optional>
#include <pwd.h>
#include <set>
#include <sys/stat.h>
#include <thread>
#include <unistd.h>
#include <vector>

namespace rolvane {
namespace {

namespace fs = std::filesystem;

// A directory of its own, and the environment and umask as they were at the end.
class PathsTest : public testing::Test {
protected:
    PathsTest() {
        std::string name = (fs::temp_directory_path() / "rolvane-paths.XXXXXX").string();
        _root = ::mkdtemp(name.data());
        for (const char* variable : kVariables) {
            const char* value = std::getenv(variable);
            _saved.push_back(value ? std::optional<std::string>(value) : std::nullopt);
            ::unsetenv(variable);
        }
        ::setenv("HOME", root("home").c_str(), 1);
        _umask = ::umask(022);
    }
    ~PathsTest() override {
        ::umask(_umask);
        for (size_t i = 0; i < _saved.size(); ++i)
            _saved[i] ? ::setenv(kVariables[i], _saved[i]->c_str(), 1) : ::unsetenv(kVariables[i]);
        std::error_code ignored;
        fs::remove_all(_root, ignored);
    }

    std::string root(const std::string& below) const { return (_root / below).string(); }
    static mode_t modeOf(const std::string& path) {
        struct stat s {};
        EXPECT_EQ(::stat(path.c_str(), &s), 0) << path;
        return s.st_mode & 07777;
    }
    static std::string refusal(const std::function<void()>& step) {
        try {
            step();
        } catch (const CXException& e) {
            return e.reason();
        }
        return "";
    }
    static size_t entriesOf(const fs::path& directory) {
        return static_cast<size_t>(std::distance(fs::directory_iterator(directory), fs::directory_iterator()));
    }

private:
    static constexpr const char* kVariables[] = {"HOME",           "XDG_DATA_HOME",   "XDG_STATE_HOME",
                                                 "XDG_CACHE_HOME", "XDG_CONFIG_HOME", "XDG_RUNTIME_DIR"};
    fs::path _root;
    std::vector<std::optional<std::string>> _saved;
    mode_t _umask = 0;
};

TEST_F(PathsTest, FallsBackToTheDirectoriesBelowHome) {
    EXPECT_EQ(dataDirectory(), root("home/.local/share/rolvane"));
    EXPECT_EQ(stateDirectory(), root("home/.local/state/rolvane"));
    EXPECT_EQ(cacheDirectory(), root("home/.cache/rolvane"));
    EXPECT_EQ(configDirectory(), root("home/.config/rolvane"));
    EXPECT_EQ(runtimeDirectory(), root("home/.local/state/rolvane/run"));
}

TEST_F(PathsTest, FollowsTheEnvironmentAtEveryCall) {
    ::setenv("XDG_DATA_HOME", root("data/").c_str(), 1);
    ::setenv("XDG_RUNTIME_DIR", root("run").c_str(), 1);
    EXPECT_EQ(dataDirectory(), root("data/rolvane"));
    EXPECT_EQ(runtimeDirectory(), root("run/rolvane"));
    ::setenv("XDG_DATA_HOME", root("other").c_str(), 1);
    EXPECT_EQ(dataDirectory(), root("other/rolvane"));
}

TEST_F(PathsTest, IgnoresRelativeDirectoriesInTheEnvironment) {
    ::setenv("XDG_STATE_HOME", "state", 1);
    ::setenv("XDG_RUNTIME_DIR", "", 1);
    EXPECT_EQ(stateDirectory(), root("home/.local/state/rolvane"));
    EXPECT_EQ(runtimeDirectory(), root("home/.local/state/rolvane/run"));
}

TEST_F(PathsTest, MakesItsDirectoriesPrivateWhateverTheUmask) {
    ::umask(0);
    EXPECT_EQ(modeOf(dataDirectory()), 0700u);
    ::umask(0277);
    EXPECT_EQ(modeOf(cacheDirectory()), 0700u);
}

TEST_F(PathsTest, TakesTheHomeOfThePasswordDatabaseWhenTheEnvironmentHasNone) {
    const passwd* entry = ::getpwuid(::geteuid());
    ASSERT_NE(entry, nullptr);
    const std::string home = entry->pw_dir, name = entry->pw_name;
    ::unsetenv("HOME");
    EXPECT_EQ(homeDirectory(), home);
    ::setenv("HOME", "relative", 1);
    EXPECT_EQ(homeDirectory(), home);
    EXPECT_EQ(loginUserName(), name);
}

TEST_F(PathsTest, MakesACompletePathAtTheModeWhateverTheUmask) {
    ::umask(077);
    CXPathUtils_MakeCompletePath(root("a//b/c/"), 0777);
    for (const char* made : {"a", "a/b", "a/b/c"}) EXPECT_EQ(modeOf(root(made)), 0777u) << made;
}

TEST_F(PathsTest, LeavesTheModeOfDirectoriesThatAreThere) {
    CXPathUtils_MakeCompletePath(root("a"), 0750);
    CXPathUtils_MakeCompletePath(root("a/b"), 0777);
    CXPathUtils_MakeCompletePath(root("a/b"), 0700);
    EXPECT_EQ(modeOf(root("a")), 0750u);
    EXPECT_EQ(modeOf(root("a/b")), 0777u);
}

TEST_F(PathsTest, FollowsALinkToADirectoryOnTheWay) {
    CXPathUtils_MakeCompletePath(root("real"), 0700);
    fs::create_directory_symlink(root("real"), root("link"));
    CXPathUtils_MakeCompletePath(root("link/x"), 0700);
    EXPECT_TRUE(fs::is_directory(root("real/x")));
}

TEST_F(PathsTest, SaysWhichPartOfAPathCannotBeMade) {
    std::ofstream(root("file")) << "x";
    const std::string reason = refusal([&] { CXPathUtils_MakeCompletePath(root("file/below"), 0700); });
    EXPECT_NE(reason.find(root("file") + "\": Not a directory"), std::string::npos) << reason;
    EXPECT_NE(refusal([] { CXPathUtils_MakeCompletePath("", 0700); }), "");
    EXPECT_NE(refusal([&] { CXPathUtils_MakeCompletePath(root(std::string("a\0b", 3)), 0700); }), "");
    fs::create_symlink(root("nowhere"), root("dangling"));
    EXPECT_NE(refusal([&] { CXPathUtils_MakeCompletePath(root("dangling"), 0700); }), "");
}

TEST_F(PathsTest, SeveralThreadsMayMakeTheSamePath) {
    std::vector<std::thread> threads;
    std::vector<std::string> reasons(4);
    for (size_t t = 0; t < reasons.size(); ++t)
        threads.emplace_back([&, t] {
            for (int i = 0; i < 50 && reasons[t].empty(); ++i)
                reasons[t] =
                    refusal([&] { CXPathUtils_MakeCompletePath(root("p" + std::to_string(i) + "/q/r"), 0700); });
        });
    for (std::thread& t : threads) t.join();
    for (const std::string& reason : reasons) EXPECT_EQ(reason, "");
    EXPECT_TRUE(fs::is_directory(root("p49/q/r")));
}

TEST_F(PathsTest, WritesAFileWholeAtItsModeAndReadsItBack) {
    ::umask(0);
    const std::string text = std::string("a\0b\n", 4) + std::string(100000, 'x');
    writeFileDurably(root("f"), text);
    EXPECT_EQ(readFile(root("f")), text);
    EXPECT_EQ(modeOf(root("f")), 0600u);
    ::umask(077);
    writeFileDurably(root("f"), "", 0644);
    EXPECT_EQ(readFile(root("f")), "");
    EXPECT_EQ(modeOf(root("f")), 0644u);
    EXPECT_EQ(entriesOf(root("")), 1u) << "a temporary file is left";
}

TEST_F(PathsTest, AFailedWriteLeavesWhatWasThereAndNoTemporaryFile) {
    fs::create_directories(root("d/full"));
    std::ofstream(root("d/full/x")) << "x";
    EXPECT_NE(refusal([&] { writeFileDurably(root("d/full"), "text"); }), ""); // a directory is in the way
    EXPECT_EQ(readFile(root("d/full/x")), "x");
    EXPECT_EQ(entriesOf(root("d")), 1u);
    const std::string reason = refusal([&] { writeFileDurably(root("none/f"), "text"); });
    EXPECT_NE(reason.find("none/f"), std::string::npos) << reason;
    EXPECT_NE(reason.find("No such file or directory"), std::string::npos) << reason;
}

TEST_F(PathsTest, WritesIntoTheCurrentDirectoryByARelativeName) {
    const fs::path before = fs::current_path();
    fs::current_path(root(""));
    writeFileDurably("relative", "x");
    fs::current_path(before);
    EXPECT_EQ(readFile(root("relative")), "x");
}

TEST_F(PathsTest, RefusesToReadWhatIsMissingTooLargeOrNoFile) {
    EXPECT_NE(refusal([&] { readFile(root("none")); }).find("No such file"), std::string::npos);
    EXPECT_NE(refusal([&] { readFile(root("")); }).find("not a regular file"), std::string::npos);
    ASSERT_EQ(::mkfifo(root("pipe").c_str(), 0600), 0);
    EXPECT_NE(refusal([&] { readFile(root("pipe")); }).find("not a regular file"), std::string::npos);
    writeFileDurably(root("f"), "12345");
    EXPECT_EQ(readFile(root("f"), 5), "12345");
    EXPECT_NE(refusal([&] { readFile(root("f"), 4); }).find("larger than 4"), std::string::npos);
}

// Whether the text is "XXXXXXXX-XXXX-4XXX-[89AB]XXX-XXXXXXXXXXXX" in upper-case hexadecimal digits.
bool isUUIDOfVersion4(const std::string& text) {
    const std::string form = "XXXXXXXX-XXXX-4XXX-VXXX-XXXXXXXXXXXX";
    if (text.size() != form.size()) return false;
    for (size_t i = 0; i < form.size(); ++i) {
        const std::string allowed = form[i] == 'X'   ? "0123456789ABCDEF"
                                    : form[i] == 'V' ? "89AB"
                                                     : std::string(1, form[i]);
        if (allowed.find(text[i]) == std::string::npos) return false;
    }
    return true;
}

TEST(UUIDTest, IsOfVersionFourInUpperCaseAndNeverTheSame) {
    std::set<std::string> all;
    for (int i = 0; i < 200; ++i) {
        const std::string id = makeUUID();
        EXPECT_TRUE(isUUIDOfVersion4(id)) << id;
        all.insert(id);
    }
    EXPECT_EQ(all.size(), 200u);
}

} // namespace
} // namespace rolvane
