#include "foundation/KeyedArchive.h"

#include "foundation/BinaryValue.h"

#include <algorithm>

namespace rolvane {

namespace {

constexpr std::string_view kMagic = "RKA1";

[[noreturn]] void refuse(const std::string& reason) {
    throw CXException(kCXArchiveException, "the keyed archive cannot be read: " + reason);
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
    std::vector<Value> entries;
    entries.reserve(objects.size());
    for (const Object& o : objects) entries.emplace_back(Dictionary{{"class", o.className}, {"keys", o.keys}});
    Bytes out(kMagic.begin(), kMagic.end());
    BinaryValue::encodeTo(Dictionary{{"objects", Array(std::move(entries))}}, out);
    return out;
}

std::vector<KeyedArchive::Object> KeyedArchive::unarchive(const Bytes& bytes) {
    if (bytes.size() < kMagic.size() || !std::equal(kMagic.begin(), kMagic.end(), bytes.begin()))
        refuse("it does not begin with \"RKA1\"");
    const Value root = BinaryValue::decode(bytes.data() + kMagic.size(), bytes.size() - kMagic.size());
    const Array* entries = root.dictionary()["objects"].arrayIf();
    if (!entries) refuse("it has no list of objects");
    std::vector<Object> objects;
    objects.reserve(entries->count());
    for (const Value& v : *entries) objects.push_back(objectFrom(v));
    return objects;
}

} // namespace rolvane
