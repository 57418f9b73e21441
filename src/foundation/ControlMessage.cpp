#include "foundation/ControlMessage.h"

#include "foundation/BinaryValue.h"
#include "foundation/CXException.h"

#include <array>
#include <utility>

namespace rolvane {

namespace {

constexpr size_t kLengthBytes = 4;
constexpr std::array<std::pair<ControlMessage::Kind, std::string_view>, 4> kKinds{
    {{ControlMessage::Kind::post, "post"},
     {ControlMessage::Kind::ask, "ask"},
     {ControlMessage::Kind::observe, "observe"},
     {ControlMessage::Kind::heard, "heard"}}};

[[noreturn]] void refuse(const char* what) {
    throw CXException(kCXArchiveException, std::string("A message on the control socket ") + what + ".");
}

std::string_view nameOf(ControlMessage::Kind kind) {
    for (const auto& [each, name] : kKinds)
        if (each == kind) return name;
    refuse("is of no kind");
}

ControlMessage::Kind kindNamed(const std::string& text) {
    for (const auto& [kind, name] : kKinds)
        if (name == text) return kind;
    refuse("is of no known kind");
}

ControlMessage messageOf(const Dictionary& body) {
    ControlMessage message;
    message.kind = kindNamed(body["kind"].string());
    message.number = body["number"].integer();
    message.observed = body["observed"].boolean();
    message.notification.name = body["name"].string();
    if (auto* object = body["object"].stringIf()) message.notification.object = *object;
    message.notification.userInfo = body["userInfo"].dictionary();
    const Array names = body["names"].array();
    for (const Value& name : names) message.names.push_back(name.string());
    return message;
}

} // namespace

std::string ControlMessage::frame() const {
    Dictionary body{{"kind", std::string(nameOf(kind))}};
    if (number != 0) body.set("number", number);
    if (kind == Kind::heard) body.set("observed", observed);
    if (kind == Kind::observe) {
        Array all;
        for (const std::string& name : names) all.append(name);
        body.set("names", all);
    }
    if (kind == Kind::post) {
        body.set("name", notification.name);
        if (notification.object) body.set("object", *notification.object);
        body.set("userInfo", notification.userInfo);
    }
    const Bytes bytes = BinaryValue::encode(body);
    if (bytes.size() > kMostBytes) refuse("is too large");
    std::string out;
    out.reserve(kLengthBytes + bytes.size());
    for (size_t i = kLengthBytes; i-- > 0;) out += static_cast<char>(bytes.size() >> (8 * i));
    return out.append(bytes.begin(), bytes.end());
}

std::optional<ControlMessage> ControlReader::next() {
    if (_bytes.size() < kLengthBytes) return std::nullopt;
    size_t length = 0;
    for (size_t i = 0; i < kLengthBytes; ++i) length = length << 8 | static_cast<uint8_t>(_bytes[i]);
    if (length > ControlMessage::kMostBytes) refuse("is too large");
    if (_bytes.size() < kLengthBytes + length) return std::nullopt;
    const auto* body = reinterpret_cast<const uint8_t*>(_bytes.data()) + kLengthBytes;
    const Value value = BinaryValue::decode(body, length);
    _bytes.erase(0, kLengthBytes + length);
    if (!value.dictionaryIf()) refuse("is no dictionary");
    return messageOf(value.dictionary());
}

} // namespace rolvane
