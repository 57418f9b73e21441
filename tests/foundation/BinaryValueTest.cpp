#include "foundation/BinaryValue.h"

#include "Generators.h"

#include <gtest/gtest.h>
#include <rapidcheck/gtest.h>

#include <limits>

namespace rolvane {
namespace {

std::string refusal(const Bytes& bytes) {
    try {
        BinaryValue::decode(bytes);
    } catch (const CXException& e) {
        EXPECT_EQ(e.name(), kCXArchiveException);
        return e.reason();
    }
    return "";
}

bool has(const std::string& text, const std::string& part) {
    return text.find(part) != std::string::npos;
}

TEST(BinaryValueTest, HasExactlyTheDocumentedForm) {
    EXPECT_EQ(BinaryValue::encode(Value()), (Bytes{0x00}));
    EXPECT_EQ(BinaryValue::encode(false), (Bytes{0x10}));
    EXPECT_EQ(BinaryValue::encode(true), (Bytes{0x11}));
    EXPECT_EQ(BinaryValue::encode(-1), (Bytes{0x02, 0x01}));
    EXPECT_EQ(BinaryValue::encode(64), (Bytes{0x02, 0x80, 0x01}));
    EXPECT_EQ(BinaryValue::encode(1.0), (Bytes{0x03, 0, 0, 0, 0, 0, 0, 0xf0, 0x3f}));
    EXPECT_EQ(BinaryValue::encode("ab"), (Bytes{0x04, 2, 'a', 'b'}));
    EXPECT_EQ(BinaryValue::encode(Date(1)), (Bytes{0x05, 0, 0, 0, 0, 0, 0, 0xf0, 0x3f}));
    EXPECT_EQ(BinaryValue::encode(Bytes{9}), (Bytes{0x06, 1, 9}));
    EXPECT_EQ(BinaryValue::encode(Array{true, Value()}), (Bytes{0x07, 2, 0x11, 0x00}));
    EXPECT_EQ(BinaryValue::encode(Dictionary{{"b", 0}, {"a", true}}),
              (Bytes{0x08, 2, 1, 'a', 0x11, 1, 'b', 0x02, 0x00}));
}

TEST(BinaryValueTest, AppendsToWhatIsThere) {
    Bytes out{0xff};
    BinaryValue::encodeTo(true, out);
    EXPECT_EQ(out, (Bytes{0xff, 0x11}));
}

TEST(BinaryValueTest, KeepsTheWholeRangeOfIntegers) {
    for (const int64_t n : {std::numeric_limits<int64_t>::min(), std::numeric_limits<int64_t>::max(), int64_t{0}})
        EXPECT_EQ(BinaryValue::decode(BinaryValue::encode(n)).integer(7), n);
}

RC_GTEST_PROP(BinaryValueTest, EveryValueComesBackAsItself, ()) {
    const Value v = *test::anyValue();
    const Bytes bytes = BinaryValue::encode(v);
    const Value back = BinaryValue::decode(bytes);
    RC_ASSERT(back == v);
    RC_ASSERT(BinaryValue::encode(back) == bytes);
}

RC_GTEST_PROP(BinaryValueTest, EveryTruncationIsRefused, ()) {
    const Bytes bytes = BinaryValue::encode(*test::anyValue());
    for (size_t n = 0; n < bytes.size(); ++n)
        RC_ASSERT(refusal(Bytes(bytes.begin(), bytes.begin() + static_cast<std::ptrdiff_t>(n))) != "");
}

RC_GTEST_PROP(BinaryValueTest, ChangedBytesAreRefusedOrAreTheOneFormOfAnotherValue, ()) {
    Bytes bytes = BinaryValue::encode(*test::anyValue());
    bytes[*rc::gen::inRange<size_t>(0, bytes.size())] = *rc::gen::arbitrary<uint8_t>();
    Value v;
    try {
        v = BinaryValue::decode(bytes);
    } catch (const CXException& e) {
        RC_ASSERT(e.name() == kCXArchiveException);
        return;
    }
    RC_ASSERT(BinaryValue::encode(v) == bytes);
}

TEST(BinaryValueTest, RefusesEveryOtherFormOfAValue) {
    EXPECT_TRUE(has(refusal({}), "too early"));
    EXPECT_TRUE(has(refusal({0x11, 0x11}), "1 bytes follow"));
    EXPECT_TRUE(has(refusal({0x01}), "unknown tag 0x01"));
    EXPECT_TRUE(has(refusal({0x12}), "unknown tag 0x12"));
    EXPECT_TRUE(has(refusal({0x02, 0x80, 0x00}), "shortest form"));
    EXPECT_TRUE(has(refusal({0x02, 0xff, 0xff, 0xff, 0xff, 0xff, 0xff, 0xff, 0xff, 0xff, 0x02}), "64 bits"));
    EXPECT_TRUE(has(refusal({0x08, 2, 1, 'b', 0x11, 1, 'a', 0x11}), "ascending"));
    EXPECT_TRUE(has(refusal({0x08, 2, 1, 'a', 0x11, 1, 'a', 0x11}), "ascending"));
    EXPECT_TRUE(has(refusal({0x08, 1, 1, 'a', 0x00}), "absent"));
}

TEST(BinaryValueTest, ALengthGreaterThanWhatFollowsReservesNothing) {
    const Bytes most{0xff, 0xff, 0xff, 0xff, 0xff, 0xff, 0xff, 0xff, 0xff, 0x01};
    for (const uint8_t tag : {0x04, 0x06, 0x07, 0x08}) {
        Bytes bytes{tag};
        bytes.insert(bytes.end(), most.begin(), most.end());
        EXPECT_TRUE(has(refusal(bytes), "greater than what follows")) << int(tag);
    }
}

TEST(BinaryValueTest, HoldsTheDepthLimitInBothDirections) {
    Value v = Array{};
    for (int i = 1; i < 64; ++i) v = Array{v};
    EXPECT_EQ(BinaryValue::decode(BinaryValue::encode(v)), v);
    EXPECT_THROW(BinaryValue::encode(Array{v}), CXException);
    Bytes deep;
    for (int i = 0; i < 65; ++i) deep.insert(deep.end(), {0x07, 0x01});
    EXPECT_TRUE(has(refusal(deep), "nested deeper than 64"));
    Dictionary self;
    self.set("self", self);
    EXPECT_THROW(BinaryValue::encode(self), CXException);
    self.remove("self"); // or it would never be freed
}

// Large data goes in and out without a copy, in the same form.
RC_GTEST_PROP(BinaryValueTest, DataInPlaceHasTheFormOfADataValue, ()) {
    const Bytes data(*rc::gen::inRange<size_t>(0, 300), *rc::gen::arbitrary<uint8_t>());
    const Bytes encoded = BinaryValue::encodeData(data);
    RC_ASSERT(encoded == BinaryValue::encode(Value(data)));
    RC_ASSERT(BinaryValue::decode(Bytes(encoded)) == Value(data));
    for (const size_t size : {encoded.size() - 1, encoded.size() + 1}) {
        Bytes broken = encoded;
        broken.resize(size);
        RC_ASSERT_THROWS_AS(BinaryValue::decode(std::move(broken)), CXException);
    }
}

} // namespace
} // namespace rolvane
