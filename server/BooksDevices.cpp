#include "server/BooksDevices.h"

#include "foundation/CXException.h"
#include "foundation/Paths.h"
#include "server/HttpdLauncher.h"
#include "server/PasswordFile.h"
#include "server/PrivateStore.h"

#include <array>
#include <openssl/rand.h>
#include <string_view>
#include <sys/stat.h>
#include <unistd.h>

namespace rolvane {

namespace {

constexpr int kLeastCost = 4;

PasswordFile passwordsIn(const std::string& directory) {
    return PasswordFile(directory + "/conf/passwords", directory + "/conf/digests", "",
                        {.digests = false, .cost = kLeastCost, .mode = 0600});
}

FileHandle lockOf(const std::string& directory) {
    return HttpdLauncher({"The server of the address books", directory, "", ""}).lock();
}

} // namespace

BooksDevices::BooksDevices(const std::string& booksDirectory)
    : _directory(booksDirectory.empty() ? stateDirectory() + "/books" : booksDirectory) {}

void BooksDevices::makeDirectories() const {
    for (const char* name : {"/conf", "/used"}) CXPathUtils_MakeCompletePath(_directory + name, 0700);
}

std::string BooksDevices::randomPassword() {
    constexpr std::string_view kCharacters = "abcdefghijkmnpqrstuvwxyz23456789"; // without l, o, 0 and 1
    static_assert(kCharacters.size() == 32);
    std::array<unsigned char, 32> random{};
    if (RAND_priv_bytes(random.data(), static_cast<int>(random.size())) != 1)
        throw CXException(kCXPrivateStoreException, "No random numbers are to be had for a device's password.");
    std::string password;
    for (size_t i = 0; i < random.size(); ++i) {
        if (i > 0 && i % 4 == 0) password += '-';
        password += kCharacters[random[i] % kCharacters.size()];
    }
    return password;
}

std::string BooksDevices::add(const std::string& name) const {
    if (!PasswordFile::isValidUser(name))
        throw CXException(kCXPrivateStoreException,
                          "\"" + name +
                              "\" cannot be the name of a device: use up to 64 letters, digits "
                              "and . _ - @ +, and begin with a letter, a digit or _.");
    makeDirectories();
    const FileHandle lock = lockOf(_directory);
    std::string password = randomPassword();
    passwordsIn(_directory).set(name, password);
    return password;
}

bool BooksDevices::remove(const std::string& name) const {
    if (!contains(name)) return false;
    makeDirectories();
    const FileHandle lock = lockOf(_directory);
    const bool known = passwordsIn(_directory).remove(name);
    if (known) unlink((_directory + "/used/" + name).c_str());
    return known;
}

bool BooksDevices::contains(const std::string& name) const {
    return passwordsIn(_directory).contains(name);
}

std::vector<BooksDevice> BooksDevices::all() const {
    std::vector<BooksDevice> devices;
    for (const std::string& name : passwordsIn(_directory).users()) {
        BooksDevice device{.name = name, .lastUse = std::nullopt};
        struct stat info {};
        if (lstat((_directory + "/used/" + name).c_str(), &info) == 0)
            device.lastUse = std::chrono::system_clock::from_time_t(info.st_mtim.tv_sec);
        devices.push_back(device);
    }
    return devices;
}

} // namespace rolvane
