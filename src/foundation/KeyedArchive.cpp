#include "foundation/KeyedArchive.h"

#include "foundation/BinaryValue.h"

#include <algorithm>

namespace rolvane {

namespace {

constexpr std::string_view kMagic = "RKA1";
constexpr size_t kProbe = 256; // so many objects tell how long the others are

[[noreturn]] void refuse(const std::string& reason) {
    throw CXException(kCXArchiveException, "the keyed archive cannot be read: " + reason);
}

void appendVarint(uint64_t n, Bytes& out) {
    for (; n >= 0x80; n >>= 7) out.push_back(static_cast<uint8_t>(n) | 0x80);
    out.push_back(static_cast<uint8_t>(n));
}

// What stands before the count of the elements in the BinaryValue form of {key: array}.
void beginDictionaryOfOneArray(std::string_view key, Bytes& out) {
    out.push_back(static_cast<uint8_t>(ValueType::dictionary));
    appendVarint(1, out);
    appendVarint(key.size(), out);
    out.insert(out.end(), key.begin(), key.end());
    out.push_back(static_cast<uint8_t>(ValueType::array));
}

KeyedArchive::Object objectFrom(const Value& v) {
    const Dictionary* entry = v.dictionaryIf();
    if (!entry) refuse("an object in it is not a dictionary");
    const std::string* name = (*entry)["class"].stringIf();
    const Dictionary* keys = (*entry)["keys"].dictionaryIf();
    if (!name || !keys) refuse("an object in it has no class name or no keys");
    return {*name, *keys};
}

} // namespace

void DictionaryCoder::encodeInteger(int64_t value, std::string_view key) {
    _entries.set(key, value);
}

void DictionaryCoder::encodeObject(const Value& value, std::string_view key) {
    if (value) _entries.set(key, value);
}

int64_t DictionaryCoder::decodeInteger(std::string_view key) const {
    return _entries[key].integer();
}

Value DictionaryCoder::decodeObject(std::string_view key) const {
    return _entries[key];
}

Bytes KeyedArchive::archive(const std::vector<Object>& objects) {
    return archive(objects.size(), [&](size_t i) { return objects[i]; });
}

Bytes KeyedArchive::archive(size_t count, const std::function<Object(size_t)>& objectAt) {
    Bytes out(kMagic.begin(), kMagic.end());
    beginDictionaryOfOneArray("objects", out);
    appendVarint(count, out);
    for (size_t i = 0; i < count; ++i) {
        if (i == kProbe) out.reserve(out.size() / kProbe * (count + count / 16) + kProbe); // else doubled several times
        const Object object = objectAt(i);
        BinaryValue::encodeTo(Dictionary{{"class", object.className}, {"keys", object.keys}}, out);
    }
    return out;
}

std::vector<KeyedArchive::Object> KeyedArchive::unarchive(const Bytes& bytes) {
    std::vector<Object> objects;
    unarchive(bytes, [&](Object object) { objects.push_back(std::move(object)); });
    return objects;
}

void KeyedArchive::unarchive(const Bytes& bytes, const std::function<void(Object)>& take) {
    if (bytes.size() < kMagic.size() || !std::equal(kMagic.begin(), kMagic.end(), bytes.begin()))
        refuse("it does not begin with \"RKA1\"");
    Bytes before;
    beginDictionaryOfOneArray("objects", before);
    const uint8_t* at = bytes.data() + kMagic.size();
    size_t left = bytes.size() - kMagic.size();
    if (left < before.size() || !std::equal(before.begin(), before.end(), at)) refuse("it has no list of objects");
    at += before.size();
    left -= before.size();
    for (uint64_t count = BinaryValue::decodeCount(at, left); count > 0; --count)
        take(objectFrom(BinaryValue::decodeFront(at, left)));
    if (left != 0) refuse(std::to_string(left) + " bytes follow its end");
}

} // namespace rolvane
