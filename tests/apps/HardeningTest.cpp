#include "ElfFile.h"

#include "support/ChildProcess.h"
#include "support/TempHome.h"
#include "support/UserWorld.h"

#include <gmock/gmock.h>

#include <algorithm>
#include <filesystem>
#include <fstream>

namespace rolvane::test {
namespace {

// All that is built and installed: both programs and both modules.
std::vector<std::string> builtFiles() {
    return {UserWorld::rolvaneProgram(), UserWorld::managerProgram(), ROLVANE_MODULE, ROLVANE_BOOKS_MODULE};
}

// What the file lacks of what keeps a fault in it from being used. Empty: nothing.
std::vector<std::string> lacks(const std::string& path) {
    const ElfFile file(path);
    std::vector<std::string> missing;
    const auto want = [&](bool has, const char* what) {
        if (!has) missing.emplace_back(what);
    };
    want(file.type() == ET_DYN, "position independence");
    want(file.segment(PT_GNU_RELRO) != nullptr, "RELRO");
    want((file.dynamic(DT_FLAGS) & DF_BIND_NOW) || (file.dynamic(DT_FLAGS_1) & DF_1_NOW), "BIND_NOW");
    const Elf64_Phdr* stack = file.segment(PT_GNU_STACK);
    want(stack && !(stack->p_flags & PF_X), "a stack that is not executed");
    want(file.dynamic(DT_RPATH) == 0 && file.dynamic(DT_RUNPATH) == 0, "freedom from paths of the build machine");
#ifdef ROLVANE_HARDENED_CODE // the quick build has none of these
    const auto imports = file.imports();
    const auto imported = [&](auto matches) { return std::any_of(imports.begin(), imports.end(), matches); };
    want(imported([](const std::string& name) { return name == "__stack_chk_fail"; }), "stack protector");
    want(imported([](const std::string& name) { return name.ends_with("_chk"); }), "FORTIFY");
    if (std::string(ROLVANE_BRANCH_PROTECTION) == "-fcf-protection=full") {
        // The C library's start files carry no mark, so the file as a whole has none. Functions whose address is taken
        // begin with the instruction "endbr64"; those that are only called directly need not.
        const auto functions = file.functions();
        const auto begun = std::count_if(functions.begin(), functions.end(), [](const ElfFile::Function& f) {
            return f.name.starts_with("_ZN7rolvane") && f.start == "\xf3\x0f\x1e\xfa";
        });
        want(begun > 10, "branch targets that the processor checks");
    }
#endif
    return missing;
}

TEST(Hardening, EveryFileThatIsInstalledHasAllOfIt) {
    for (const std::string& path : builtFiles()) EXPECT_THAT(lacks(path), testing::IsEmpty()) << path;
}

TEST(Hardening, TheTestNoticesAFileThatHasNone) {
    const TempDirectory directory;
    const std::string source = directory / "plain.c", program = directory / "plain";
    ChildProcess compiler(
        ChildProcess::Options{.arguments = {"cc", "-x", "c", "-", "-o", program, "-no-pie", "-fno-stack-protector",
                                            "-Wl,-z,norelro,-z,lazy,-z,execstack", "-Wl,-rpath,/tmp"},
                              .input = "int main(void) { return 0; }\n"});
    ASSERT_TRUE(compiler.wait()->exitedWith(0)) << compiler.errors();
    EXPECT_THAT(lacks(program),
                testing::IsSupersetOf({"position independence", "RELRO", "BIND_NOW", "a stack that is not executed",
                                       "freedom from paths of the build machine"}));
#ifdef ROLVANE_HARDENED_CODE
    EXPECT_THAT(lacks(program), testing::IsSupersetOf({"stack protector", "FORTIFY"}));
#endif
}

void install(const std::string& prefix, const std::vector<std::string>& more = {}) {
    // It writes into the directory of the build, so two of them take turns.
    std::vector<std::string> command = {
        "flock", ROLVANE_BINARY_DIR "/install.lock", ROLVANE_CMAKE, "--install", ROLVANE_BINARY_DIR, "--prefix",
        prefix};
    command.insert(command.end(), more.begin(), more.end());
    ChildProcess installing(command);
    const auto ending = installing.wait(120);
    ASSERT_TRUE(ending && ending->exitedWith(0)) << installing.output() << installing.errors();
}

TEST(Hardening, WhatIsInstalledHasNoSymbolsAndTheyAreToBeHadApart) {
    const TempDirectory directory;
    install(directory / "usr");
    for (const char* name : {"usr/bin/rolvane", "usr/bin/RolvaneManager", "usr/lib/apache2/modules/mod_davacl.so",
                             "usr/lib/apache2/modules/mod_cardbook.so"}) {
        const std::string path = directory / name;
        const ElfFile file(path);
        EXPECT_FALSE(file.hasSection(".symtab")) << name;
        EXPECT_FALSE(file.hasSection(".debug_info")) << name;
        EXPECT_TRUE(file.hasSection(".note.gnu.build-id")) << name;
        EXPECT_LT(std::filesystem::file_size(path), 32u << 20) << name;
    }
    EXPECT_FALSE(std::filesystem::exists(directory / "usr/lib/debug"));

    install(directory / "apart", {"--component", "debug"});
    size_t found = 0;
    for (const auto& each : std::filesystem::recursive_directory_iterator(directory / "apart"))
        if (each.is_regular_file()) {
            EXPECT_TRUE(ElfFile(each.path()).hasSection(".debug_info")) << each.path();
            EXPECT_EQ(each.path().parent_path().parent_path(), directory / "apart/lib/debug/.build-id");
            ++found;
        }
    EXPECT_EQ(found, builtFiles().size());
}

TEST(Uninstalling, TakesAwayWhatWasInstalledAndNothingElse) {
    namespace fs = std::filesystem;
    const TempDirectory directory;
    const std::string prefix = directory / "usr/local";
    install(prefix);
    const std::string settings = prefix + "/etc/apache2/mods-available/davacl.conf", others = prefix + "/bin/other";
    std::ofstream(settings, std::ios::app) << "# an administrator's line\n";
    std::ofstream(others) << "somebody else's\n";
    ChildProcess uninstalling(
        ChildProcess::Options{.arguments = {ROLVANE_SOURCE_DIR "/packaging/uninstall", ROLVANE_BINARY_DIR, prefix}});
    const auto ending = uninstalling.wait(120);
    ASSERT_TRUE(ending && ending->exitedWith(0)) << uninstalling.output() << uninstalling.errors();
    std::vector<std::string> left;
    for (const auto& each : fs::recursive_directory_iterator(directory.path()))
        if (!each.is_directory()) left.push_back(each.path());
    EXPECT_THAT(left, testing::UnorderedElementsAre(settings, others));
    EXPECT_FALSE(fs::exists(prefix + "/share")) << "an empty directory stays";
    EXPECT_NE(uninstalling.output().find(settings), std::string::npos) << uninstalling.output();
}

} // namespace
} // namespace rolvane::test
