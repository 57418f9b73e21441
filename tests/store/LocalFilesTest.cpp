#include "store/files/LocalFiles.h"

#include "foundation/PropertyList.h"
#include "store/dav/CXDAVManager.h"
#include "support/TempHome.h"

#include <atomic>
#include <cerrno>
#include <filesystem>
#include <fstream>
#include <gtest/gtest.h>
#include <iterator>
#include <sys/stat.h>
#include <thread>
#include <unistd.h>

namespace rolvane {
namespace {

using namespace test;
namespace fs = std::filesystem;

std::string contents(const std::string& path) {
    std::ifstream in(path, std::ios::binary);
    return std::string(std::istreambuf_iterator<char>(in), {});
}

void put(const std::string& path, const std::string& text) {
    std::ofstream(path, std::ios::binary) << text;
}

mode_t modeOf(const std::string& path) {
    struct stat status {};
    return ::lstat(path.c_str(), &status) == 0 ? status.st_mode & 07777 : 0;
}

std::vector<std::string> names(const std::optional<FileListing>& listing) {
    std::vector<std::string> all;
    if (!listing) return {"no listing"};
    for (const auto& [path, info] : *listing) all.push_back(info.displayName + (info.isCollection ? "/" : ""));
    return all;
}

// A folder that strangers may write to, and somebody's own folder beside it.
class LocalFolder : public testing::Test {
protected:
    LocalFolder() {
        fs::create_directory(root);
        fs::create_directory(own);
        put(own + "/secret", "mine");
    }
    Url url(const std::string& name) const { return Url::fileURL(root + "/" + name); }

    TempDirectory directory;
    const std::string root = directory / "shared", own = directory / "own";
    LocalFiles files{root};
    CXFileManager manager, rooted{root};
};

// -- plain work

TEST_F(LocalFolder, WritesReadsAndReplacesFiles) {
    EXPECT_EQ(files.write(root + "/a", "first and longer"), 0);
    EXPECT_EQ(files.write(root + "/a", "second"), 0);
    std::string text;
    EXPECT_EQ(files.read(root + "/a", text), 0);
    EXPECT_EQ(text, "second");
    EXPECT_EQ(files.read(root + "/b", text), ENOENT);
    EXPECT_EQ(files.write(root + "/no/b", "x"), ENOENT) << "the folder must exist";
    EXPECT_EQ(files.read(root + "/a", text, 5), EFBIG);
}

TEST_F(LocalFolder, GivesExactlyTheModeAskedForWhateverTheUmask) {
    const mode_t former = ::umask(077);
    EXPECT_EQ(files.makeDirectories(root + "/x/y", 0777), 0);
    EXPECT_EQ(files.write(root + "/x/y/f", "", 0777), 0);
    EXPECT_EQ(files.write(root + "/x/y/g", ""), 0);
    ::umask(former);
    EXPECT_EQ(modeOf(root + "/x"), 0777u);
    EXPECT_EQ(modeOf(root + "/x/y"), 0777u);
    EXPECT_EQ(modeOf(root + "/x/y/f"), 0777u);
    EXPECT_EQ(modeOf(root + "/x/y/g"), 0600u);
}

TEST_F(LocalFolder, DirectoriesThatExistKeepTheirMode) {
    fs::create_directory(root + "/x");
    ::chmod((root + "/x").c_str(), 0750);
    EXPECT_EQ(files.makeDirectories(root + "/x/y", 0777), 0);
    EXPECT_EQ(modeOf(root + "/x"), 0750u);
    EXPECT_EQ(files.makeDirectories(root + "/x/y", 0700), 0);
    EXPECT_EQ(modeOf(root + "/x/y"), 0777u);
}

TEST_F(LocalFolder, MakesARootThatIsMissing) {
    LocalFiles missing(directory / "not/yet");
    EXPECT_EQ(missing.makeDirectories(directory / "not/yet/alice", 0777), 0);
    EXPECT_TRUE(fs::is_directory(directory / "not/yet/alice"));
}

TEST_F(LocalFolder, RemovesTreesAndCountsAbsenceAsRemoved) {
    fs::create_directories(root + "/g/deep/er");
    put(root + "/g/deep/er/f", "x");
    EXPECT_TRUE(rooted.removeDirectoryAndContentsAtURL(url("g")));
    EXPECT_FALSE(fs::exists(root + "/g"));
    EXPECT_TRUE(rooted.removeDirectoryAndContentsAtURL(url("g")));
    put(root + "/file", "x");
    EXPECT_TRUE(rooted.removeDirectoryAndContentsAtURL(url("file")));
    EXPECT_FALSE(fs::exists(root + "/file"));
}

// -- links

TEST_F(LocalFolder, ALinkInAFilesPlaceIsNeitherReadNorWritten) {
    fs::create_symlink(own + "/secret", root + "/a");
    std::string text;
    EXPECT_EQ(files.read(root + "/a", text), ELOOP);
    EXPECT_EQ(files.write(root + "/a", "x", 0777), ELOOP);
    EXPECT_FALSE(manager.write("x", url("a"), false)) << "without a root, too";
    EXPECT_EQ(contents(own + "/secret"), "mine");
    EXPECT_NE(modeOf(own + "/secret"), 0777u);
}

TEST_F(LocalFolder, AWriteThroughALinkToNowhereMakesNoFile) {
    fs::create_symlink(own + "/new", root + "/a");
    EXPECT_FALSE(manager.write("x", url("a"), false));
    EXPECT_FALSE(rooted.write("x", url("a"), false));
    EXPECT_FALSE(fs::exists(own + "/new"));
}

TEST_F(LocalFolder, ALinkOnTheWayLeadsNowhereBelowTheRoot) {
    fs::create_directory_symlink(own, root + "/alice");
    std::string text;
    EXPECT_EQ(files.read(root + "/alice/secret", text), ELOOP);
    EXPECT_EQ(files.write(root + "/alice/new", "x"), ELOOP);
    EXPECT_EQ(files.makeDirectories(root + "/alice/People", 0777), ELOOP);
    EXPECT_EQ(files.removeFile(root + "/alice/secret"), ELOOP);
    EXPECT_FALSE(rooted.removeDirectoryAndContentsAtURL(url("alice/secret")));
    EXPECT_FALSE(rooted.infoForFilesInContainer(url("alice")));
    EXPECT_EQ(std::distance(fs::directory_iterator(own), fs::directory_iterator()), 1)
        << "only the secret, and still it";
    EXPECT_EQ(contents(own + "/secret"), "mine");
}

TEST_F(LocalFolder, WithoutARootOnlyTheLastComponentIsLookedAt) {
    fs::create_directory_symlink(own, directory / "linked");
    EXPECT_TRUE(manager.write("x", Url::fileURL(directory / "linked/new"), false));
    EXPECT_EQ(contents(own + "/new"), "x");
}

TEST_F(LocalFolder, TheRootItselfMayBeReachedThroughALink) {
    fs::create_directory_symlink(root, directory / "way");
    LocalFiles through(directory / "way");
    EXPECT_EQ(through.makeDirectories(directory / "way/x", 0777), 0);
    EXPECT_EQ(through.write(directory / "way/x/f", "t"), 0);
    EXPECT_EQ(contents(root + "/x/f"), "t");
}

TEST_F(LocalFolder, RemovingATreeTakesTheLinksInItAndNotWhatTheyName) {
    fs::create_directory(root + "/g");
    fs::create_directory_symlink(own, root + "/g/dir");
    fs::create_symlink(own + "/secret", root + "/g/file");
    EXPECT_TRUE(rooted.removeDirectoryAndContentsAtURL(url("g")));
    EXPECT_FALSE(fs::exists(root + "/g"));
    EXPECT_EQ(contents(own + "/secret"), "mine");
    fs::create_directory_symlink(own, root + "/link");
    EXPECT_TRUE(rooted.removeDirectoryAndContentsAtURL(url("link")));
    EXPECT_EQ(contents(own + "/secret"), "mine");
}

TEST_F(LocalFolder, ALinkIsNotTakenForAbsenceNorForARefusal) {
    fs::create_symlink(own + "/secret", root + "/info");
    fs::create_directory_symlink(own, root + "/alice");
    int code = 0;
    EXPECT_FALSE(rooted.dictionaryAtURL(url("info"), &code, false));
    EXPECT_EQ(code, 500);
    EXPECT_FALSE(rooted.dictionaryAtURL(url("alice/info"), &code, false));
    EXPECT_EQ(code, 500);
}

// -- other things than files

TEST_F(LocalFolder, AFileWithASecondNameIsNotWritten) {
    fs::create_hard_link(own + "/secret", root + "/a");
    EXPECT_EQ(files.write(root + "/a", "x", 0777), EMLINK);
    EXPECT_EQ(contents(own + "/secret"), "mine");
    EXPECT_NE(modeOf(own + "/secret"), 0777u);
}

TEST_F(LocalFolder, APipeOrADirectoryInAFilesPlaceNeverMakesAnybodyWait) {
    ASSERT_EQ(::mkfifo((root + "/pipe").c_str(), 0666), 0);
    fs::create_directory(root + "/dir");
    std::string text;
    EXPECT_EQ(files.read(root + "/pipe", text), EINVAL);
    EXPECT_NE(files.write(root + "/pipe", "x"), 0);
    EXPECT_NE(files.read(root + "/dir", text), 0);
    EXPECT_EQ(files.write(root + "/dir", "x"), EISDIR);
}

TEST_F(LocalFolder, AListingHoldsFilesAndFoldersOnly) {
    put(root + "/file", "abc");
    fs::create_directory(root + "/dir");
    fs::create_symlink(own + "/secret", root + "/link");
    ASSERT_EQ(::mkfifo((root + "/pipe").c_str(), 0666), 0);
    put(root + "/.state", "");
    const auto listing = manager.infoForFilesInContainer(Url::fileURL(root));
    EXPECT_EQ(names(listing), (std::vector<std::string>{"dir/", "file"}));
    EXPECT_EQ(listing->at(root + "/file").size, 3u);
    EXPECT_TRUE(listing->at(root + "/file").modificationdate);
}

TEST_F(LocalFolder, PathsThatLeadElsewhereAreRefused) {
    std::string text;
    for (const std::string& path : {root + "/../own/secret", root + "/./a", own + "/secret", directory.path(), root,
                                    root + "2/a", std::string("relative"), std::string(), std::string("/")}) {
        EXPECT_EQ(files.read(path, text), EINVAL) << path;
        EXPECT_EQ(files.write(path, "x"), EINVAL) << path;
        EXPECT_EQ(files.removeTree(path), EINVAL) << path;
    }
    EXPECT_EQ(files.read(root + "/a" + std::string(1, '\0') + "b", text), EINVAL);
    for (const char* hostile : {"file:/tmp/..%2F..%2Fetc/passwd", "file:/tmp/%2E%2E/etc", "file://elsewhere/tmp/x"}) {
        int code = 0;
        EXPECT_FALSE(manager.dictionaryAtURL(Url(hostile), &code, false));
        EXPECT_EQ(code, 500) << hostile;
        EXPECT_FALSE(manager.write("x", Url(hostile), false));
        EXPECT_FALSE(manager.infoForFilesInContainer(Url(hostile)));
        EXPECT_FALSE(manager.removeDirectoryAndContentsAtURL(Url(hostile)));
    }
    EXPECT_EQ(contents(own + "/secret"), "mine");
}

// -- a group's file and folder

TEST_F(LocalFolder, ADictionaryAtAFolderLiesInsideIt) {
    fs::create_directory(root + "/G:CXGroup");
    const std::string text = PropertyList::toXML(Dictionary{{"a", 1}});
    EXPECT_TRUE(rooted.write(text, url("G:CXGroup"), false));
    EXPECT_TRUE(fs::exists(root + "/G:CXGroup/" + CXDAVManager::kStateName));
    int code = 0;
    EXPECT_EQ(rooted.dictionaryAtURL(url("G:CXGroup"), &code, false).value_or(Dictionary()), (Dictionary{{"a", 1}}));
    EXPECT_EQ(code, 200);
    EXPECT_EQ(names(rooted.infoForFilesInContainer(url("G:CXGroup"))), std::vector<std::string>{});
}

TEST_F(LocalFolder, TextThatIsNoDictionaryIsThereAndGivesNone) {
    put(root + "/a", "no property list");
    int code = 0;
    EXPECT_FALSE(rooted.dictionaryAtURL(url("a"), &code, false));
    EXPECT_EQ(code, 200);
    EXPECT_FALSE(rooted.dictionaryAtURL(url("none"), &code, false));
    EXPECT_EQ(code, 404);
}

// -- folders that come and go while they are read

TEST_F(LocalFolder, AFolderThatVanishesWhileItIsListedGivesAllOfItOrNothing) {
    fs::create_directory(root + "/here");
    for (int i = 0; i < 40; ++i) put(root + "/here/f" + std::to_string(i), "x");
    std::atomic<bool> ending = false;
    std::thread mover([&] {
        while (!ending) {
            fs::rename(root + "/here", root + "/away");
            fs::rename(root + "/away", root + "/here");
        }
    });
    int whole = 0, absent = 0;
    for (int i = 0; i < 3000; ++i) {
        const auto listing = rooted.infoForFilesInContainer(url("here"));
        if (!listing)
            ++absent;
        else if (listing->size() == 40)
            ++whole;
    }
    ending = true;
    mover.join();
    EXPECT_EQ(whole + absent, 3000);
    EXPECT_GT(whole, 0);
}

TEST_F(LocalFolder, AFolderThatIsRemovedAndMadeAgainWhileItIsListedNeverThrows) {
    std::atomic<bool> ending = false;
    std::thread remover([&] {
        std::error_code ignored;
        while (!ending) {
            fs::create_directory(root + "/here", ignored);
            put(root + "/here/f", "x");
            fs::remove_all(root + "/here", ignored);
        }
    });
    for (int i = 0; i < 3000; ++i) {
        const auto listing = rooted.infoForFilesInContainer(url("here"));
        EXPECT_LE(listing.value_or(FileListing()).size(), 1u);
    }
    ending = true;
    remover.join();
    EXPECT_FALSE(rooted.infoForFilesInContainer(url("never")));
}

TEST_F(LocalFolder, ADeepTreeIsRemovedWithoutRunningOutOfAnything) {
    std::string path = root + "/t";
    for (int i = 0; i < 200; ++i) path += "/d";
    fs::create_directories(path);
    EXPECT_TRUE(rooted.removeDirectoryAndContentsAtURL(url("t")));
    EXPECT_FALSE(fs::exists(root + "/t"));
}

} // namespace
} // namespace rolvane
