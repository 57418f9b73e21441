#include "foundation/NotificationMessage.h"

#include "foundation/Utf8.h"

#include <algorithm>
#include <cerrno>
#include <cstring>

namespace rolvane {

namespace {

constexpr const char* kObjectKey = "object";
// A bus carries 64 containers inside one another and drops the connection of who sends more; a dictionary in a variant
// takes three.
constexpr int kDeepest = 16;
constexpr const char* kReplacement = "\xef\xbf\xbd"; // U+FFFD

// sd-bus reports through its return values; the first failure ends the writing.
#define RETURN_IF_NEGATIVE(expression)                                                                                 \
    do {                                                                                                               \
        if (int failure_ = (expression); failure_ < 0) return failure_;                                                \
    } while (false)

bool isTooDeep(const Value& value, int deepest) {
    auto inner = [&](const Value& v) { return isTooDeep(v, deepest - 1); };
    if (auto* array = value.arrayIf()) return deepest == 0 || std::any_of(array->begin(), array->end(), inner);
    auto* dictionary = value.dictionaryIf();
    return dictionary && (deepest == 0 || std::any_of(dictionary->begin(), dictionary->end(),
                                                      [&](const auto& entry) { return inner(entry.second); }));
}

int appendDictionary(sd_bus_message* m, const Dictionary& dictionary, const std::optional<std::string>& object);

int appendText(sd_bus_message* m, std::string_view text) {
    return sd_bus_message_append_basic(m, 's', busText(text).c_str());
}

int appendContents(sd_bus_message* m, const Value& value);

// The signature of a value inside its variant.
const char* signatureOf(const Value& value) {
    switch (value.type()) {
    case ValueType::boolean: return "b";
    case ValueType::integer: return "x";
    case ValueType::real: return "d";
    case ValueType::string: return "s";
    case ValueType::date: return "(d)";
    case ValueType::data: return "ay";
    case ValueType::array: return "av";
    case ValueType::dictionary: return "a{sv}";
    case ValueType::absent: break;
    }
    return "g";
}

int appendVariant(sd_bus_message* m, const Value& value) {
    RETURN_IF_NEGATIVE(sd_bus_message_open_container(m, 'v', signatureOf(value)));
    RETURN_IF_NEGATIVE(appendContents(m, value));
    return sd_bus_message_close_container(m);
}

int appendArray(sd_bus_message* m, const Array& array) {
    RETURN_IF_NEGATIVE(sd_bus_message_open_container(m, 'a', "v"));
    for (const auto& element : array) RETURN_IF_NEGATIVE(appendVariant(m, element));
    return sd_bus_message_close_container(m);
}

int appendContents(sd_bus_message* m, const Value& value) {
    switch (value.type()) {
    case ValueType::boolean: return sd_bus_message_append(m, "b", static_cast<int>(value.boolean()));
    case ValueType::integer: return sd_bus_message_append(m, "x", value.integer());
    case ValueType::real: return sd_bus_message_append(m, "d", value.real());
    case ValueType::string: return appendText(m, value.string());
    case ValueType::date: return sd_bus_message_append(m, "(d)", value.date()->secondsSince1970());
    case ValueType::data: return sd_bus_message_append_array(m, 'y', value.data().data(), value.data().size());
    case ValueType::array: return appendArray(m, *value.arrayIf());
    case ValueType::dictionary: return appendDictionary(m, *value.dictionaryIf(), std::nullopt);
    case ValueType::absent: break;
    }
    return sd_bus_message_append_basic(m, 'g', "");
}

int appendEntry(sd_bus_message* m, const std::string& key, const Value& value) {
    RETURN_IF_NEGATIVE(sd_bus_message_open_container(m, 'e', "sv"));
    RETURN_IF_NEGATIVE(appendText(m, key));
    RETURN_IF_NEGATIVE(appendVariant(m, value));
    return sd_bus_message_close_container(m);
}

int appendDictionary(sd_bus_message* m, const Dictionary& dictionary, const std::optional<std::string>& object) {
    RETURN_IF_NEGATIVE(sd_bus_message_open_container(m, 'a', "{sv}"));
    for (const auto& [key, value] : dictionary)
        if (!object || key != kObjectKey) RETURN_IF_NEGATIVE(appendEntry(m, key, value));
    if (object) RETURN_IF_NEGATIVE(appendEntry(m, kObjectKey, *object));
    return sd_bus_message_close_container(m);
}

#undef RETURN_IF_NEGATIVE

Value readValue(sd_bus_message* m);

template <class T>
T readBasic(sd_bus_message* m, char type) {
    T value{};
    sd_bus_message_read_basic(m, type, &value);
    return value;
}

// The elements of the container that is next; what cannot be read ends it.
Array readElements(sd_bus_message* m, char type, const char* contents) {
    Array out;
    if (sd_bus_message_enter_container(m, type, contents) < 0) return out;
    while (sd_bus_message_at_end(m, 0) == 0) {
        char next = 0;
        if (sd_bus_message_peek_type(m, &next, nullptr) <= 0) break;
        out.append(readValue(m));
    }
    sd_bus_message_exit_container(m);
    return out;
}

Dictionary readDictionary(sd_bus_message* m, const char* contents) {
    Dictionary out;
    std::string entry(contents + 1, std::strlen(contents) - 2); // "{sv}" without its braces
    if (sd_bus_message_enter_container(m, 'a', contents) < 0) return out;
    while (sd_bus_message_enter_container(m, 'e', entry.c_str()) > 0) {
        auto* key = readBasic<const char*>(m, 's');
        if (auto value = readValue(m); key && value) out.set(key, std::move(value));
        if (sd_bus_message_exit_container(m) < 0) break;
    }
    sd_bus_message_exit_container(m);
    return out;
}

Value readData(sd_bus_message* m) {
    const void* bytes = nullptr;
    size_t size = 0;
    if (sd_bus_message_read_array(m, 'y', &bytes, &size) < 0) return {};
    auto* first = static_cast<const uint8_t*>(bytes);
    return Value(Bytes(first, first + size));
}

Value readContainer(sd_bus_message* m, char type, const char* contents) {
    if (type == 'v') {
        if (sd_bus_message_enter_container(m, 'v', contents) < 0) return {};
        Value value = readValue(m);
        sd_bus_message_exit_container(m);
        return value;
    }
    if (type == 'a' && std::strcmp(contents, "y") == 0) return readData(m);
    if (type == 'a' && std::strncmp(contents, "{s", 2) == 0) return readDictionary(m, contents);
    Array elements = readElements(m, type, contents);
    if (type == 'r' && std::strcmp(contents, "d") == 0 && elements.count() == 1) return Date(elements[0].real());
    return elements;
}

// The next value of any type; the absent value for what has no counterpart.
Value readValue(sd_bus_message* m) {
    char type = 0;
    const char* contents = nullptr;
    if (sd_bus_message_peek_type(m, &type, &contents) <= 0) return {};
    switch (type) {
    case 'b': return readBasic<int>(m, type) != 0;
    case 'y': return static_cast<int>(readBasic<uint8_t>(m, type));
    case 'n': return static_cast<int>(readBasic<int16_t>(m, type));
    case 'q': return static_cast<int>(readBasic<uint16_t>(m, type));
    case 'i': return readBasic<int32_t>(m, type);
    case 'u': return readBasic<uint32_t>(m, type);
    case 'x': return readBasic<int64_t>(m, type);
    case 't': return static_cast<int64_t>(readBasic<uint64_t>(m, type));
    case 'd': return readBasic<double>(m, type);
    case 's':
    case 'o': {
        auto* text = readBasic<const char*>(m, type);
        return text ? Value(text) : Value();
    }
    case 'v':
    case 'a':
    case 'r': return readContainer(m, type, contents);
    default: sd_bus_message_skip(m, std::string(1, type).c_str()); return {};
    }
}

} // namespace

std::string busText(std::string_view text) {
    std::string out;
    out.reserve(text.size());
    while (!text.empty()) {
        size_t plain = 0; // ASCII but NUL
        while (plain < text.size() && text[plain] > 0 && static_cast<unsigned char>(text[plain]) < 0x80) ++plain;
        out += text.substr(0, plain);
        text.remove_prefix(plain);
        if (text.empty()) break;
        auto character = takeCodePoint(text);
        if (character && *character != 0)
            appendUtf8(*character, out);
        else
            out += kReplacement;
        if (!character) text.remove_prefix(1);
    }
    return out;
}

int makeNotificationMessage(sd_bus* bus, const Notification& notification, BusMessage& message) {
    if (isTooDeep(notification.userInfo, kDeepest)) return -EMSGSIZE;
    sd_bus_message* made = nullptr;
    int result =
        sd_bus_message_new_signal(bus, &made, kNotificationPath, kNotificationInterface, notification.name.c_str());
    BusMessage owned(made);
    if (result >= 0) result = appendDictionary(made, notification.userInfo, notification.object);
    if (result >= 0) message = std::move(owned);
    return result;
}

Notification readNotificationMessage(sd_bus_message* message) {
    Notification out;
    out.name = sd_bus_message_get_member(message);
    char type = 0;
    const char* contents = nullptr;
    if (sd_bus_message_peek_type(message, &type, &contents) > 0 && type == 'a' && std::strncmp(contents, "{s", 2) == 0)
        out.userInfo = readDictionary(message, contents);
    if (auto* object = out.userInfo[kObjectKey].stringIf()) {
        out.object = *object;
        out.userInfo.remove(kObjectKey);
    }
    return out;
}

} // namespace rolvane
