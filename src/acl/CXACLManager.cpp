#include "acl/CXACLManager.h"

#include "foundation/CXException.h"
#include "foundation/Log.h"

#include <algorithm>
#include <array>
#include <cstdint>
#include <openssl/evp.h>
#include <string_view>

namespace rolvane {
namespace {

constexpr int kBucketCount = 32;

using Digest = std::array<unsigned char, EVP_MAX_MD_SIZE>;

// The one place that asks OpenSSL for an MD5 digest; here it spreads names, it protects nothing.
Digest md5(std::string_view bytes) {
    // Found once, for the process's life: OpenSSL looks an algorithm up anew at each use of its plain name.
    static const EVP_MD* const fetched = EVP_MD_fetch(nullptr, "MD5", nullptr);
    Digest digest{};
    if (!fetched || EVP_Digest(bytes.data(), bytes.size(), digest.data(), nullptr, fetched, nullptr) != 1)
        throw CXException("CXDigestException",
                          "MD5 is not available from the system's OpenSSL; a bucket cannot be named");
    return digest;
}

// UTF-16 code units of the text: one for every byte that starts a character, two where that character lies beyond the
// basic plane. A byte that belongs to no character counts as one unit.
size_t utf16Length(std::string_view text) {
    size_t units = 0;
    for (unsigned char byte : text) {
        const bool continuation = (byte & 0xC0) == 0x80;
        if (!continuation) units += byte >= 0xF0 ? 2 : 1;
    }
    return units;
}

bool contains(const std::vector<UserName>& list, const UserName& principal) {
    return std::find(list.begin(), list.end(), principal) != list.end();
}

void addIfAbsent(std::vector<UserName>& list, const UserName& principal) {
    if (!contains(list, principal)) list.push_back(principal);
}

void removeFrom(std::vector<UserName>& list, const UserName& principal) {
    std::erase(list, principal);
}

} // namespace

CXACLManager::CXACLManager(Url baseLocation, const LocationOwner& owner)
    : _baseLocation(std::move(baseLocation)),
      _publisher(owner.userForRemoteLocation(RemoteLocation(_baseLocation.absoluteString())) == kSelf) {}

bool CXACLManager::load() {
    return false;
}

bool CXACLManager::validate() {
    return true;
}

bool CXACLManager::save() {
    return validate();
}

void CXACLManager::grantPrincipal(const UserName& principal, bool allAccess) {
    make({principal, allAccess, true, true});
}

void CXACLManager::denyPrincipal(const UserName& principal, bool allAccess) {
    make({principal, allAccess, false, true});
}

void CXACLManager::grantReadPermissionForGUID(const UniqueId& guid, const std::vector<UniqueId>& members,
                                              const UserName& toAccount) {
    _grant(true, guid, members, toAccount, false);
}

void CXACLManager::grantReadWritePermissionForGUID(const UniqueId& guid, const std::vector<UniqueId>& members,
                                                   const UserName& toAccount) {
    _grant(true, guid, members, toAccount, true);
}

void CXACLManager::denyReadPermissionForGUID(const UniqueId& guid, const std::vector<UniqueId>& members,
                                             const UserName& toAccount) {
    _grant(false, guid, members, toAccount, false);
}

void CXACLManager::denyReadWritePermissionForGUID(const UniqueId& guid, const std::vector<UniqueId>& members,
                                                  const UserName& toAccount) {
    _grant(false, guid, members, toAccount, true);
}

// One list serves the whole base location: which group the right was asked for makes no difference.
void CXACLManager::_grant(bool grant, const UniqueId& /*guid*/, const std::vector<UniqueId>& /*members*/,
                          const UserName& toAccount, bool readWrite) {
    make({toAccount, readWrite, grant, false});
}

void CXACLManager::make(const Change& change) {
    willChange(change);
    carryOut(change);
}

void CXACLManager::carryOut(const Change& change) {
    std::vector<UserName>& list = change.allAccess ? _allAccessPrincipals : _readAccessPrincipals;
    if (change.grant) {
        if (contains(list, change.principal)) return; // the readers stay as they are, even without this writer
        list.push_back(change.principal);
        if (change.allAccess && !change.oneListOnly) addIfAbsent(_readAccessPrincipals, change.principal);
        return;
    }
    removeFrom(list, change.principal);
    // Whoever may not read may not write either.
    if (!change.allAccess && !change.oneListOnly) removeFrom(_allAccessPrincipals, change.principal);
}

std::vector<Url> CXACLManager::affectedURLsForGUID(const UniqueId& guid, const std::vector<UniqueId>& members) const {
    const Url people = _baseLocation.cxURLByAppendingComponent("People");
    std::vector<Url> urls;
    urls.reserve(members.size() + 1);
    for (const UniqueId& member : members)
        urls.push_back(
            people.cxURLByAppendingComponent(bucketNameForUID(member)).cxURLByAppendingComponent(member.str()));
    urls.push_back(_baseLocation.cxURLByAppendingComponent(guid.str()));
    return urls;
}

std::vector<Url> CXACLManager::bucketURLs() const {
    const Url people = _baseLocation.cxURLByAppendingComponent("People");
    std::vector<Url> urls;
    urls.reserve(kBucketCount);
    for (int bucket = 0; bucket < kBucketCount; ++bucket)
        urls.push_back(people.cxURLByAppendingComponent(std::to_string(bucket)));
    return urls;
}

std::vector<Url> CXACLManager::otherStructureURLs() const {
    return {_baseLocation, _baseLocation.cxURLByAppendingComponent("info"),
            _baseLocation.cxURLByAppendingComponent("dateFile")};
}

std::string CXACLManager::bucketNameForUID(const UniqueId& uid) {
    const std::string_view text = uid.str();
    const Digest digest = md5(text.substr(0, utf16Length(text)));
    return std::to_string(digest[0] % kBucketCount);
}

std::string CXACLManager::description() const {
    const std::string inherited = CXFormat("<%s: 0x%x>", className(), reinterpret_cast<uintptr_t>(this));
    return CXFormat("%@\nReaders: %@\nWriters: %@", inherited, _readAccessPrincipals, _allAccessPrincipals);
}

} // namespace rolvane
