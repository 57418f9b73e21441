#include "foundation/BinaryValue.h"

#include <bit>
#include <cstring>
#include <fmt/format.h>

namespace rolvane {

namespace {

constexpr uint8_t kFalse = 0x10;
constexpr uint8_t kTrue = 0x11;

[[noreturn]] void refuse(const std::string& reason) {
    throw CXException(kCXArchiveException, "the binary value cannot be used: " + reason);
}

class Encoder {
public:
    explicit Encoder(Bytes& out) : _out(out) {}

    void value(const Value& v) {
        switch (v.type()) {
        case ValueType::boolean: _out.push_back(v.boolean() ? kTrue : kFalse); return;
        case ValueType::array: array(*v.arrayIf()); return;
        case ValueType::dictionary: dictionary(*v.dictionaryIf()); return;
        default: leaf(v);
        }
    }
    void varint(uint64_t n) {
        for (; n >= 0x80; n >>= 7) _out.push_back(static_cast<uint8_t>(n) | 0x80);
        _out.push_back(static_cast<uint8_t>(n));
    }

private:
    void leaf(const Value& v) {
        tag(v.type());
        switch (v.type()) {
        case ValueType::integer: varint(zigzag(v.integer())); break;
        case ValueType::real: real(v.real()); break;
        case ValueType::date: real(v.date()->secondsSince1970()); break;
        case ValueType::string: bytes(v.string().data(), v.string().size()); break;
        case ValueType::data: bytes(v.data().data(), v.data().size()); break;
        default: break; // absent: the tag is all
        }
    }

    void array(const Array& a) {
        enter();
        tag(ValueType::array);
        varint(a.count());
        for (const Value& item : a) value(item);
        --_depth;
    }

    void dictionary(const Dictionary& d) {
        enter();
        tag(ValueType::dictionary);
        varint(d.count());
        for (const auto& [key, item] : d) {
            bytes(key.data(), key.size());
            value(item);
        }
        --_depth;
    }

    void enter() {
        if (++_depth > BinaryValue::kMaxDepth)
            refuse(fmt::format("its containers are nested deeper than {}", BinaryValue::kMaxDepth));
    }
    void tag(ValueType t) { _out.push_back(static_cast<uint8_t>(t)); }
    void real(double d) {
        auto bits = std::bit_cast<uint64_t>(d);
        for (int i = 0; i < 8; ++i, bits >>= 8) _out.push_back(static_cast<uint8_t>(bits));
    }
    void bytes(const void* data, size_t size) {
        varint(size);
        const auto* from = static_cast<const uint8_t*>(data);
        _out.insert(_out.end(), from, from + size);
    }
    static uint64_t zigzag(int64_t n) {
        return (static_cast<uint64_t>(n) << 1) ^ static_cast<uint64_t>(n < 0 ? -1 : 0);
    }

    Bytes& _out;
    int _depth = 0;
};

class Decoder {
public:
    Decoder(const uint8_t* data, size_t size) : _at(data), _end(data + size) {}

    Value whole() {
        Value v = value();
        if (_at != _end) refuse(fmt::format("{} bytes follow its end", left()));
        return v;
    }
    const uint8_t* at() const { return _at; }
    Value value() {
        const uint8_t tag = byte();
        if (tag == kFalse || tag == kTrue) return tag == kTrue;
        switch (static_cast<ValueType>(tag)) {
        case ValueType::absent: return {};
        case ValueType::integer: return unzigzag(varint());
        case ValueType::real: return real();
        case ValueType::string: return string();
        case ValueType::date: return Date(real());
        case ValueType::data: return data();
        case ValueType::array: return array();
        case ValueType::dictionary: return dictionary();
        default: refuse(fmt::format("it has the unknown tag 0x{:02x}", tag));
        }
    }

    uint64_t varint() {
        uint64_t n = 0;
        for (int shift = 0;; shift += 7) {
            const uint8_t b = byte();
            if (shift == 63 && b > 1) refuse("a number in it has more than 64 bits");
            n |= static_cast<uint64_t>(b & 0x7f) << shift;
            if (b & 0x80) continue;
            if (b == 0 && shift > 0) refuse("a number in it is not in its shortest form");
            return n;
        }
    }

private:
    Array array() {
        enter();
        const size_t n = count(1);
        std::vector<Value> items;
        items.reserve(n);
        for (size_t i = 0; i < n; ++i) items.push_back(value());
        --_depth;
        return Array(std::move(items));
    }

    Dictionary dictionary() {
        enter();
        Dictionary d;
        std::string_view last;
        for (size_t n = count(2), i = 0; i < n; ++i) {
            const std::string_view text = stringView();
            if (i > 0 && text <= last) refuse("the keys of a dictionary are not in ascending order");
            last = text;
            std::string key(text);
            Value v = value();
            if (v.isAbsent()) refuse("a dictionary holds an absent value");
            d.setIfNew(std::move(key), std::move(v));
        }
        --_depth;
        return d;
    }

    void enter() {
        if (++_depth > BinaryValue::kMaxDepth)
            refuse(fmt::format("its containers are nested deeper than {}", BinaryValue::kMaxDepth));
    }
    size_t left() const { return static_cast<size_t>(_end - _at); }
    uint8_t byte() {
        if (_at == _end) refuse("it ends too early");
        return *_at++;
    }
    // A count of elements of at least `each` bytes: never more than the bytes that are left can hold.
    size_t count(size_t each) {
        const uint64_t n = varint();
        if (n > left() / each) refuse("a length in it is greater than what follows");
        return static_cast<size_t>(n);
    }
    double real() {
        if (left() < 8) refuse("it ends too early");
        uint64_t bits = 0;
        for (int i = 0; i < 8; ++i) bits |= static_cast<uint64_t>(*_at++) << (8 * i);
        return std::bit_cast<double>(bits);
    }
    std::string string() { return std::string(stringView()); }
    std::string_view stringView() {
        const size_t n = count(1);
        const std::string_view s(reinterpret_cast<const char*>(_at), n);
        _at += n;
        return s;
    }
    Bytes data() {
        const size_t n = count(1);
        Bytes b(_at, _at + n);
        _at += n;
        return b;
    }
    static Value unzigzag(uint64_t n) { return static_cast<int64_t>(n >> 1) ^ -static_cast<int64_t>(n & 1); }

    const uint8_t* _at;
    const uint8_t* _end;
    int _depth = 0;
};

} // namespace

Bytes BinaryValue::encode(const Value& value) {
    Bytes out;
    encodeTo(value, out);
    return out;
}

void BinaryValue::encodeTo(const Value& value, Bytes& out) {
    Encoder(out).value(value);
}

Value BinaryValue::decode(const uint8_t* data, size_t size) {
    return Decoder(data, size).whole();
}

Bytes BinaryValue::encodeData(Bytes data) {
    Bytes front{static_cast<uint8_t>(ValueType::data)};
    Encoder(front).varint(data.size());
    data.insert(data.begin(), front.begin(), front.end());
    return data;
}

Value BinaryValue::decode(Bytes&& bytes) {
    if (bytes.empty() || bytes.front() != static_cast<uint8_t>(ValueType::data))
        return decode(bytes.data(), bytes.size());
    const uint8_t* at = bytes.data() + 1;
    size_t left = bytes.size() - 1;
    if (decodeCount(at, left) != left) return decode(bytes.data(), bytes.size()); // which says what is wrong
    bytes.erase(bytes.begin(), bytes.end() - static_cast<std::ptrdiff_t>(left));
    return Value(std::move(bytes));
}

Value BinaryValue::decodeFront(const uint8_t*& data, size_t& size) {
    Decoder decoder(data, size);
    Value v = decoder.value();
    size -= static_cast<size_t>(decoder.at() - data);
    data = decoder.at();
    return v;
}

uint64_t BinaryValue::decodeCount(const uint8_t*& data, size_t& size) {
    Decoder decoder(data, size);
    const uint64_t n = decoder.varint();
    size -= static_cast<size_t>(decoder.at() - data);
    data = decoder.at();
    return n;
}

} // namespace rolvane
