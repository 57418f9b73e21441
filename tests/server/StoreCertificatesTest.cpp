#include "server/StoreCertificates.h"

#include "StoreTestWorld.h"
#include "foundation/Paths.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/stat.h>

namespace rolvane {
namespace {

using namespace std::chrono_literals;
using testing::HasSubstr;

const std::vector<std::string> kHosts = {"localhost", "127.0.0.1", "::1"};
constexpr auto kYear = 24h * 365;

std::string shown(const std::string& file) {
    return runCommand({"openssl", "x509", "-in", file, "-noout", "-text"}).output;
}

int verified(const StoreCertificates& certificates, const std::vector<std::string>& more) {
    std::vector<std::string> command = {"openssl",   "verify",  "-x509_strict",       "-purpose",
                                        "sslserver", "-CAfile", certificates.caFile()};
    command.insert(command.end(), more.begin(), more.end());
    command.push_back(certificates.certificateFile());
    return runCommand(command).status;
}

TEST(StoreCertificates, StandUpToAStrictCheckForEveryHostAndNoOther) {
    const StoreDirectory directory;
    StoreCertificates certificates(directory.path("tls"));
    EXPECT_TRUE(certificates.ensure(kHosts, kYear));
    EXPECT_EQ(verified(certificates, {"-verify_hostname", "localhost"}), 0);
    EXPECT_EQ(verified(certificates, {"-verify_ip", "127.0.0.1"}), 0);
    EXPECT_EQ(verified(certificates, {"-verify_ip", "::1"}), 0);
    EXPECT_NE(verified(certificates, {"-verify_hostname", "example.org"}), 0);
    EXPECT_NE(verified(certificates, {"-verify_ip", "127.0.0.2"}), 0);
}

TEST(StoreCertificates, UseEllipticKeysAndCannotSignFurtherOnes) {
    const StoreDirectory directory;
    StoreCertificates certificates(directory.path("tls"));
    certificates.ensure(kHosts, kYear);
    EXPECT_THAT(shown(certificates.certificateFile()), HasSubstr("prime256v1"));
    EXPECT_THAT(shown(certificates.certificateFile()), HasSubstr("CA:FALSE"));
    EXPECT_THAT(shown(certificates.caFile()), HasSubstr("CA:TRUE, pathlen:0"));
}

TEST(StoreCertificates, KeepTheServersKeyPrivateAndTheAuthoritysKeyNowhere) {
    const StoreDirectory directory;
    StoreCertificates certificates(directory.path("tls"));
    certificates.ensure(kHosts, kYear);
    struct stat info {};
    ASSERT_EQ(stat(certificates.keyFile().c_str(), &info), 0);
    EXPECT_EQ(info.st_mode & 0777, 0600u);
    size_t keys = 0;
    for (const auto& entry : std::filesystem::directory_iterator(directory.path("tls")))
        keys += readFile(entry.path().string()).find("PRIVATE KEY") != std::string::npos;
    EXPECT_EQ(keys, 1u);
}

TEST(StoreCertificates, StayWhileTheyAreGood) {
    const StoreDirectory directory;
    StoreCertificates certificates(directory.path("tls"));
    certificates.ensure(kHosts, kYear);
    const std::string authority = readFile(certificates.caFile());
    EXPECT_FALSE(certificates.ensure(kHosts, kYear));
    EXPECT_EQ(readFile(certificates.caFile()), authority);
}

TEST(StoreCertificates, AreRenewedBeforeTheyEnd) {
    const StoreDirectory directory;
    StoreCertificates certificates(directory.path("tls"));
    certificates.ensure(kHosts, 24h);
    EXPECT_TRUE(certificates.ensure(kHosts, kYear)) << "a day is left, a year's certificate wants thirty";
    EXPECT_FALSE(certificates.ensure(kHosts, kYear));
}

TEST(StoreCertificates, AreRenewedForOtherHosts) {
    const StoreDirectory directory;
    StoreCertificates certificates(directory.path("tls"));
    certificates.ensure(kHosts, kYear);
    const std::vector<std::string> more = {"localhost", "127.0.0.1", "::1", "store.example"};
    EXPECT_TRUE(certificates.ensure(more, kYear));
    EXPECT_EQ(verified(certificates, {"-verify_hostname", "store.example"}), 0);
    EXPECT_TRUE(certificates.ensure(kHosts, kYear)) << "a name too many is no good either";
    EXPECT_FALSE(certificates.ensure(kHosts, kYear));
}

// Every file, missing, empty or another store's: a renewal that was interrupted, a restored backup.
TEST(StoreCertificates, AreMadeAnewWhenAFileDoesNotFit) {
    const StoreDirectory directory;
    StoreCertificates certificates(directory.path("tls")), others(directory.path("others"));
    for (const char* name : {"ca.pem", "server.pem", "server.key"}) {
        const std::string file = directory.path("tls/") + name;
        for (int damage = 0; damage < 3; ++damage) {
            certificates.ensure(kHosts, kYear);
            others.ensure(kHosts, kYear);
            if (damage == 0) std::filesystem::remove(file);
            if (damage == 1) writeFileDurably(file, "");
            if (damage == 2) writeFileDurably(file, readFile(directory.path("others/") + name));
            EXPECT_TRUE(certificates.ensure(kHosts, kYear)) << name << " " << damage;
            EXPECT_EQ(verified(certificates, {}), 0);
        }
    }
}

} // namespace
} // namespace rolvane
