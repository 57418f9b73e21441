#include "model/CXDChangeRecord.h"

#include "foundation/PropertyList.h"

#include <algorithm>
#include <fmt/format.h>
#include <gtest/gtest.h>

namespace rolvane {
namespace {

const UniqueId kPerson{"P1:CXPerson"};
const UniqueId kGroup{"G1:CXGroup"};

CXDChangeRecord record(int32_t type, int32_t appliesTo, Value payload = {}) {
    CXDChangeRecord r(CXDSyncSourceCX, type, kSelf, kPerson, kGroup, std::move(payload));
    r.setAppliesToSources(appliesTo);
    return r;
}

std::string withoutAddress(const CXDChangeRecord& r) {
    const std::string text = r.description();
    return text.substr(text.find('>') + 1);
}

// A coder that is not keyed: nothing may reach it.
class SequentialCoder : public Coder {
public:
    int calls = 0;
    bool allowsKeyedCoding() const override { return false; }
    void encodeInteger(int64_t, std::string_view) override { ++calls; }
    void encodeObject(const Value&, std::string_view) override { ++calls; }
    int64_t decodeInteger(std::string_view) const override { return 7; }
    Value decodeObject(std::string_view) const override { return "unexpected"; }
};

// Keeps what is written, and shows it.
class MapCoder : public Coder {
public:
    std::map<std::string, Value, std::less<>> entries;
    bool allowsKeyedCoding() const override { return true; }
    void encodeInteger(int64_t value, std::string_view key) override { entries[std::string(key)] = value; }
    void encodeObject(const Value& value, std::string_view key) override {
        if (value) entries[std::string(key)] = value;
    }
    int64_t decodeInteger(std::string_view key) const override { return decodeObject(key).integer(); }
    Value decodeObject(std::string_view key) const override {
        const auto it = entries.find(key);
        return it == entries.end() ? Value() : it->second;
    }
};

std::shared_ptr<const Bytes> encoded(const Value& value) {
    return std::make_shared<const Bytes>(BinaryValue::encode(value));
}

constexpr std::string_view kOlderArchive =
    "524b41310801076f626a656374730702080205636c617373040f4358444368616e67655265636f7264046b6579730806"
    "134358444170706c696573546f536f757263657302080d4358444368616e676554797065020210435844496e69746961"
    "6c536f7572636502020a4358445061796c6f6164061808020546697273740403416e6e0550686f6e6507010401310c43"
    "5844506572736f6e554944040b50313a4358506572736f6e074358445573657204063c73656c663e080205636c617373"
    "040f4358444368616e67655265636f7264046b6579730806134358444170706c696573546f536f757263657302080d43"
    "58444368616e67655479706502080b43584447726f7570554944040a47313a435847726f757010435844496e69746961"
    "6c536f7572636502020a4358445061796c6f616406090407467269656e6473074358445573657204063c73656c663e";

Bytes bytesOf(std::string_view hexadecimal) {
    Bytes bytes;
    for (size_t i = 0; i + 1 < hexadecimal.size(); i += 2)
        bytes.push_back(static_cast<uint8_t>(std::stoi(std::string(hexadecimal.substr(i, 2)), nullptr, 16)));
    return bytes;
}

TEST(ChangeRecord, StartsWithBothMasksAtZeroAndKeepsWhatItWasGiven) {
    const CXDChangeRecord r(CXDSyncSourceVaultra, CXDAddRecordToGroup, UserName("ann"), kPerson, kGroup, "payload");
    EXPECT_EQ(r.initialSource(), CXDSyncSourceVaultra);
    EXPECT_EQ(r.type(), CXDAddRecordToGroup);
    EXPECT_EQ(r.user(), UserName("ann"));
    EXPECT_EQ(r.person(), kPerson);
    EXPECT_EQ(r.group(), kGroup);
    EXPECT_EQ(r.inMemoryPayload(), Value("payload"));
    EXPECT_EQ(r.appliesToSources(), 0);
    EXPECT_EQ(r.appliedToSources(), 0);
}

TEST(ChangeRecord, SettingAMaskReplacesItWhole) {
    CXDChangeRecord r = record(CXDUpdateRecord, 5);
    r.setAppliesToSources(2);
    r.setAppliedToSources(4);
    r.setAppliedToSources(1);
    EXPECT_EQ(r.appliesToSources(), 2);
    EXPECT_EQ(r.appliedToSources(), 1);
}

TEST(ChangeRecord, OrdersByTypeAsUnsignedNumbersAndByNothingElse) {
    EXPECT_TRUE(record(9, 1).compare(record(257, 1)) < 0);
    EXPECT_TRUE(record(261, 1).compare(record(1, 1)) > 0);
    const CXDChangeRecord other(CXDSyncSourceVaultra, 1, UserName("bob"), UniqueId("X"), std::nullopt);
    EXPECT_TRUE(record(1, 1).compare(other) == 0);
    EXPECT_TRUE(record(-1, 1).compare(record(1, 1)) > 0) << "a negative type is a large unsigned number";
}

TEST(ChangeRecord, RecordsThatDifferOnlyInPayloadOrAppliedMaskAreEqual) {
    CXDChangeRecord a = record(CXDChangeGroupName, 4, "old");
    CXDChangeRecord b = record(CXDChangeGroupName, 4, "new");
    b.setAppliedToSources(4);
    EXPECT_TRUE(a.isEqual(b));
    EXPECT_TRUE(a.isEqual(a));
}

TEST(ChangeRecord, EveryOtherFieldTellsRecordsApart) {
    const CXDChangeRecord a = record(4, 4);
    const auto differs = [&](int32_t source, int32_t type, int32_t mask, std::optional<UserName> user,
                             std::optional<UniqueId> person, std::optional<UniqueId> group) {
        CXDChangeRecord b(source, type, user, person, group);
        b.setAppliesToSources(mask);
        return !a.isEqual(b) && !b.isEqual(a);
    };
    EXPECT_FALSE(differs(1, 4, 4, kSelf, kPerson, kGroup));
    EXPECT_TRUE(differs(4, 4, 4, kSelf, kPerson, kGroup));
    EXPECT_TRUE(differs(1, 5, 4, kSelf, kPerson, kGroup));
    EXPECT_TRUE(differs(1, 4, 5, kSelf, kPerson, kGroup));
    EXPECT_TRUE(differs(1, 4, 4, UserName("ann"), kPerson, kGroup));
    EXPECT_TRUE(differs(1, 4, 4, std::nullopt, kPerson, kGroup));
    EXPECT_TRUE(differs(1, 4, 4, kSelf, std::nullopt, kGroup));
    EXPECT_TRUE(differs(1, 4, 4, kSelf, kPerson, std::nullopt));
}

TEST(ChangeRecord, AbsentIdentifiersAndUsersAreEqualToAbsentOnes) {
    const CXDChangeRecord a(1, 1, std::nullopt, std::nullopt, std::nullopt);
    const CXDChangeRecord b(1, 1, std::nullopt, std::nullopt, std::nullopt);
    EXPECT_TRUE(a.isEqual(b));
}

TEST(ChangeRecord, DescriptionShowsAddressSourceTypeMaskAndIdentifiers) {
    const CXDChangeRecord r = record(CXDAddRecordToGroup, 4);
    EXPECT_EQ(r.description(),
              fmt::format("<{:x}>CX | CXDAddRecordToGroup | Vaultra  | P1:CXPerson | G1:CXGroup | <self> | ",
                          reinterpret_cast<uintptr_t>(&r)));
}

TEST(ChangeRecord, DescriptionPrintsMaskBitsInOrderAndLeavesAnEmptyColumnEmpty) {
    CXDChangeRecord r(CXDSyncSourcePending, CXDDeleteGroup, std::nullopt, std::nullopt, std::nullopt);
    EXPECT_EQ(withoutAddress(r), "Pending | CXDDeleteGroup |  | ");
    r.setAppliesToSources(31);
    EXPECT_EQ(withoutAddress(r), "Pending | CXDDeleteGroup | CX Local Vaultra Convoka Pending  | ");
}

TEST(ChangeRecord, AnInitialSourceOfTwoBitsPrintsNothingButTheMaskPrintsBoth) {
    CXDChangeRecord r(3, 99, kSelf, std::nullopt, std::nullopt);
    r.setAppliesToSources(3);
    EXPECT_EQ(withoutAddress(r), " |  | CX Local  | <self> | ");
}

TEST(ChangeRecord, AKeyedArchiveGivesEverythingBackButTheAppliedMask) {
    CXDChangeRecord r = record(CXDUpdateDistributionList, 20, Dictionary{{"a", Array{1, "x"}}});
    r.setAppliedToSources(4);
    MapCoder coder;
    r.encodeWithCoder(coder);
    CXDChangeRecord back(coder);
    EXPECT_TRUE(back.isEqual(r));
    EXPECT_EQ(back.payload(), r.payload());
    EXPECT_EQ(back.appliedToSources(), 0);
    const auto keys = [&] {
        std::vector<std::string> all;
        for (const auto& [key, value] : coder.entries) all.push_back(key);
        return all;
    }();
    EXPECT_EQ(keys, (std::vector<std::string>{"CXDAppliesToSources", "CXDChangeType", "CXDGroupUID", "CXDInitialSource",
                                              "CXDPayload", "CXDPersonUID", "CXDUser"}));
}

TEST(ChangeRecord, AbsentObjectsAreNotWrittenAndComeBackAbsent) {
    MapCoder coder;
    CXDChangeRecord(1, 260, std::nullopt, std::nullopt, std::nullopt).encodeWithCoder(coder);
    EXPECT_EQ(coder.entries.size(), 3u);
    CXDChangeRecord back(coder);
    EXPECT_FALSE(back.person() || back.group() || back.user());
    EXPECT_FALSE(back.payload());
    EXPECT_EQ(back.type(), 260);
}

TEST(ChangeRecord, APayloadOfAnyKindSurvivesTheArchiveDataIncluded) {
    for (const Value& payload : {Value("name"), Value(Array{1, 2}), Value(Bytes{1, 2, 3}), Value(Dictionary{}),
                                 Value(2.5), Value(true), Value(Date(12.5))}) {
        MapCoder coder;
        record(1, 4, payload).encodeWithCoder(coder);
        EXPECT_EQ(CXDChangeRecord(coder).payload(), payload) << payload.description();
    }
}

TEST(ChangeRecord, ACoderWithoutKeysIsGivenNothingAndYieldsAnEmptyRecord) {
    SequentialCoder coder;
    record(4, 4, "name").encodeWithCoder(coder);
    EXPECT_EQ(coder.calls, 0);
    CXDChangeRecord back(coder);
    EXPECT_TRUE(back.isEqual(CXDChangeRecord()));
    EXPECT_FALSE(back.payload());
}

TEST(ChangeRecord, ACopySharesThePayloadObjectAndStartsUnapplied) {
    Dictionary payload{{"a", 1}};
    CXDChangeRecord r = record(CXDCompositeGroupChange, 6, payload);
    r.setAppliedToSources(2);
    const CXDChangeRecordPtr copy = r.copy();
    EXPECT_TRUE(copy->isEqual(r));
    EXPECT_EQ(copy->appliedToSources(), 0);
    copy->payload().dictionary().set("b", 2);
    EXPECT_EQ(r.payload(), Value(Dictionary{{"a", 1}, {"b", 2}}));
}

TEST(ChangeRecord, ACopyOfAnEncodedPayloadSharesWhatIsDecodedLater) {
    CXDChangeRecord r = record(1, 4);
    r.setEncodedPayload(encoded(Dictionary{{"a", 1}}));
    const CXDChangeRecordPtr copy = r.copy();
    copy->payload().dictionary().set("b", 2);
    EXPECT_EQ(r.payload(), Value(Dictionary{{"a", 1}, {"b", 2}}));
}

TEST(ChangeRecord, SettingThePayloadOfOneRecordLeavesItsCopiesAlone) {
    CXDChangeRecord r = record(4, 4, "old");
    const CXDChangeRecordPtr copy = r.copy();
    r.setPayload("new");
    EXPECT_EQ(copy->payload(), Value("old"));
    r.setPayload({});
    EXPECT_FALSE(r.payload());
}

TEST(ChangeRecord, AnEncodedPayloadIsDecodedOnceAndStaysTheSameObject) {
    CXDChangeRecord r = record(1, 4);
    r.setEncodedPayload(encoded(Dictionary{{"First", "Ann"}}));
    const Value first = r.payload();
    EXPECT_EQ(first, Value(Dictionary{{"First", "Ann"}}));
    EXPECT_TRUE(first.dictionaryIf()->isSame(*r.payload().dictionaryIf()));
}

TEST(ChangeRecord, AnArchivedPayloadIsThePayloadItself) {
    const Dictionary contact{{"First", "Ann"}, {"Phone", Array{"1"}}};
    for (const Value& payload : {Value(contact), Value("name"), Value(Array{1, 2})}) {
        CXDChangeRecord given = record(1, 4, payload), read = record(1, 4);
        read.setEncodedPayload(encoded(payload));
        for (const CXDChangeRecord* r : {&given, &read}) {
            MapCoder coder;
            r->encodeWithCoder(coder);
            EXPECT_EQ(coder.entries["CXDPayload"], payload);
            EXPECT_EQ(CXDChangeRecord(coder).payload(), payload);
        }
    }
}

// An archive as version 0.1 wrote it: the payload's bytes under the key.
TEST(ChangeRecord, AnOlderArchivesPayloadIsRead) {
    const Bytes archive = bytesOf(kOlderArchive);
    const auto objects = KeyedArchive::unarchive(archive);
    ASSERT_EQ(objects.size(), 2U);
    EXPECT_TRUE(objects[0].keys["CXDPayload"].isData());
    CXDChangeRecord update{DictionaryCoder(objects[0].keys)};
    EXPECT_EQ(update.type(), CXDUpdateRecord);
    EXPECT_EQ(update.person(), UniqueId("P1:CXPerson"));
    EXPECT_EQ(update.payload(), Value(Dictionary{{"First", "Ann"}, {"Phone", Array{"1"}}}));
    CXDChangeRecord rename{DictionaryCoder(objects[1].keys)};
    EXPECT_EQ(rename.type(), CXDChangeGroupName);
    EXPECT_EQ(rename.payload(), Value("Friends"));
}

TEST(ChangeRecord, APayloadThatCannotBeDecodedStaysInTheArchiveAsItIs) {
    CXDChangeRecord r = record(1, 4);
    const Bytes undecodable{0xff, 0xfe};
    r.setEncodedPayload(std::make_shared<const Bytes>(undecodable));
    MapCoder coder;
    EXPECT_NO_THROW(r.encodeWithCoder(coder));
    CXDChangeRecord back(coder);
    MapCoder again;
    EXPECT_NO_THROW(back.encodeWithCoder(again));
    EXPECT_EQ(again.entries["CXDPayload"].data(), undecodable);
    EXPECT_THROW(back.payload(), CXException) << "only a look inside finds the damage";
}

TEST(ChangeRecord, PackingKeepsWhatWasChangedInTheTree) {
    CXDChangeRecord r = record(1, 4);
    r.setEncodedPayload(encoded(Dictionary{{"a", 1}}));
    const Dictionary before = r.payload().dictionary();
    r.payload().dictionary().set("b", 2);
    r.packPayload();
    EXPECT_EQ(r.payload(), Value(Dictionary{{"a", 1}, {"b", 2}}));
    EXPECT_FALSE(before.isSame(r.payload().dictionary())) << "the former tree has been let go";
}

TEST(ChangeRecord, PackingAPayloadGivenAsAValueKeepsIt) {
    CXDChangeRecord r = record(4, 4, "name");
    r.packPayload();
    EXPECT_EQ(r.payload(), Value("name"));
    CXDChangeRecord none = record(5, 4);
    none.packPayload();
    EXPECT_FALSE(none.payload());
}

} // namespace
} // namespace rolvane
