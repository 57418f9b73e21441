#include "CommandWorld.h"

#include <filesystem>
#include <regex>

namespace rolvane::test {
namespace {

const std::vector<std::string> kPages{"rolvane.1",          "RolvaneManager.8",     "rolvane-formats.5",
                                      "mod_davacl.5",       "rolvane-books.7",      "rolvane-computers.7",
                                      "rolvane-moving.7",   "rolvane-backing-up.7", "rolvane-upgrading.7",
                                      "rolvane-removing.7", "rolvane-store.7"};

std::string pagePath(const std::string& page) {
    return ROLVANE_BINARY_DIR "/packaging/man/" + page;
}

struct Manual : testing::Test {
    CommandWorld world;
    // As a reader sees it, on one line.
    std::string shown(const std::string& page) {
        world.home.setVariable("MANWIDTH", "80");
        world.home.setVariable("LC_ALL", "C.UTF-8");
        const Ran ran = world.run({"man", "-l", pagePath(page)});
        EXPECT_EQ(ran.status, 0) << page << ran;
        return std::regex_replace(ran.output, std::regex("\\s+"), " ");
    }
};

TEST_F(Manual, EachPageIsFoundByItsNameAndRefersToPagesThatThereAre) {
    const std::regex reference("([A-Za-z_-]*(?:olvane|davacl)[A-Za-z_-]*)\\(([0-9])\\)");
    for (const std::string& page : kPages) {
        const Ran indexed = world.run({"lexgrog", pagePath(page)});
        EXPECT_EQ(indexed.status, 0) << page << indexed;
        EXPECT_NE(indexed.output.find(page.substr(0, page.rfind('.')) + " - "), std::string::npos) << indexed;
        const std::string text = shown(page);
        size_t references = 0;
        for (std::sregex_iterator i(text.begin(), text.end(), reference), end; i != end; ++i, ++references)
            EXPECT_TRUE(std::filesystem::exists(pagePath((*i)[1].str() + "." + (*i)[2].str())))
                << page << " refers to " << i->str();
        EXPECT_GT(references, 1U) << page;
        EXPECT_FALSE(std::regex_search(text, std::regex("<[A-Za-z./_-]+\\.md")))
            << page << " links to a file beside it";
    }
}

TEST_F(Manual, TheExitCodesOfThePageAreThoseOfTheHelp) {
    const std::string help = world.done({"help", "exit-codes"}), text = shown("rolvane.1");
    size_t begin = help.find('\n') + 1, codes = 0;
    for (size_t end; (end = help.find('\n', begin)) != std::string::npos; begin = end + 1, ++codes) {
        const std::string line = help.substr(begin, end - begin); // "  0  done"
        EXPECT_NE(text.find(" " + line.substr(2, 1) + " " + line.substr(5) + "."), std::string::npos) << line;
    }
    EXPECT_EQ(codes, 7U);
}

TEST_F(Manual, TheDaemonsOptionIsInItsPage) {
    EXPECT_NE(shown("RolvaneManager.8").find("-p End as soon as it is idle: one pass, and no more."),
              std::string::npos);
}

// `[text](place)`, where the place is a file beside the document.
std::vector<std::string> linksOf(const std::string& document) {
    std::vector<std::string> links;
    const std::regex link("\\]\\(([^)#]+)(#[^)]*)?\\)");
    for (std::sregex_iterator i(document.begin(), document.end(), link), end; i != end; ++i)
        if (const std::string place = (*i)[1]; place.find("://") == std::string::npos) links.push_back(place);
    return links;
}

TEST_F(Manual, LinksOfInstalledDocumentsLeadSomewhere) {
    namespace fs = std::filesystem;
    const std::string prefix = world.home / "usr";
    const Ran installed = world.run({"flock", ROLVANE_BINARY_DIR "/install.lock", ROLVANE_CMAKE, "--install",
                                     ROLVANE_BINARY_DIR, "--prefix", prefix});
    ASSERT_EQ(installed.status, 0) << installed;
    for (const std::string& page : kPages)
        EXPECT_TRUE(fs::exists(prefix + "/share/man/man" + page.substr(page.rfind('.') + 1) + "/" + page)) << page;
    size_t links = 0;
    for (const auto& each : fs::recursive_directory_iterator(prefix + "/share/doc"))
        if (each.path().extension() == ".md")
            for (const std::string& link : linksOf(contentsOf(each.path()))) {
                EXPECT_TRUE(fs::exists(each.path().parent_path() / link)) << each.path() << " links to " << link;
                ++links;
            }
    EXPECT_GT(links, 10U);
}

} // namespace
} // namespace rolvane::test
