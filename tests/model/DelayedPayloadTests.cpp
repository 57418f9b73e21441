#include "model/CXDChangeRecord.h"
#include "store/files/CXFileManager.h"

#include <gtest/gtest.h>

namespace rolvane {
namespace {

// Answers with what it was given, and remembers what was asked.
class RecordingFileManager : public CXFileManager {
public:
    std::optional<Dictionary> answer;
    std::vector<std::string> asked;
    bool alwaysSecurely = true;
    std::optional<Dictionary> dictionaryAtURL(const Url& url, int* errorCode, bool securely) override {
        asked.push_back(url.absoluteString());
        alwaysSecurely = alwaysSecurely && securely;
        if (errorCode) *errorCode = answer ? 200 : 404;
        return answer;
    }
};

class DelayedPayload : public ::testing::Test {
protected:
    RecordingFileManager manager;
    const Url url{"http://store.example/ann/Contacts/People/3/P1"};
    CXDChangeRecord record{CXDSyncSourceVaultra, CXDUpdateRecord, UserName("ann"), UniqueId("P1:CXPerson"),
                           std::nullopt};
};

TEST_F(DelayedPayload, LaysTheEntriesInMemoryOverTheFetchedOnes) {
    manager.answer = Dictionary{{"First", "Ann"}, {"RemoteLocation", "theirs"}};
    record.setPayload(Dictionary{{"RemoteLocation", "ours"}});
    record.setDelayedPayloadURL(url, &manager);
    EXPECT_EQ(record.payload(), Value(Dictionary{{"First", "Ann"}, {"RemoteLocation", "ours"}}));
    EXPECT_EQ(record.inMemoryPayload(), Value(Dictionary{{"First", "Ann"}, {"RemoteLocation", "ours"}}));
    EXPECT_EQ(*manager.answer, (Dictionary{{"First", "Ann"}, {"RemoteLocation", "theirs"}}))
        << "the fetched dictionary itself is not written to";
}

TEST_F(DelayedPayload, IsReadAgainAndSecurelyAtEveryCall) {
    manager.answer = Dictionary{{"First", "Ann"}};
    record.setDelayedPayloadURL(url, &manager);
    record.payload();
    manager.answer = Dictionary{{"Last", "Smith"}};
    EXPECT_EQ(record.payload(), Value(Dictionary{{"First", "Ann"}, {"Last", "Smith"}}));
    EXPECT_EQ(manager.asked, (std::vector<std::string>{url.absoluteString(), url.absoluteString()}));
    EXPECT_TRUE(manager.alwaysSecurely);
}

TEST_F(DelayedPayload, AFailedReadGivesThePayloadInMemoryUnchanged) {
    record.setDelayedPayloadURL(url, &manager);
    EXPECT_FALSE(record.payload());
    record.setPayload(Dictionary{{"stamp", 1}});
    EXPECT_EQ(record.payload(), Value(Dictionary{{"stamp", 1}}));
    EXPECT_EQ(manager.asked.size(), 2u);
}

TEST_F(DelayedPayload, SettingThePayloadDoesNotTouchIt) {
    manager.answer = Dictionary{{"First", "Ann"}};
    record.setDelayedPayloadURL(url, &manager);
    record.setPayload(Dictionary{{"a", 1}});
    EXPECT_EQ(record.payload(), Value(Dictionary{{"First", "Ann"}, {"a", 1}}));
}

TEST_F(DelayedPayload, TheSameURLAgainChangesNothingNotEvenTheFileManager) {
    RecordingFileManager other;
    record.setDelayedPayloadURL(url, &manager);
    record.setDelayedPayloadURL(Url(url.absoluteString()), &other);
    record.payload();
    EXPECT_EQ(manager.asked.size(), 1u);
    EXPECT_TRUE(other.asked.empty());
}

TEST_F(DelayedPayload, AnotherURLReplacesBoth) {
    RecordingFileManager other;
    record.setDelayedPayloadURL(url, &manager);
    record.setDelayedPayloadURL(Url("http://store.example/bob/Contacts/People/3/P1"), &other);
    record.payload();
    EXPECT_TRUE(manager.asked.empty());
    EXPECT_EQ(other.asked, std::vector<std::string>{"http://store.example/bob/Contacts/People/3/P1"});
}

TEST_F(DelayedPayload, WithoutAFileManagerNothingIsRead) {
    record.setDelayedPayloadURL(url, nullptr);
    EXPECT_FALSE(record.payload());
}

TEST_F(DelayedPayload, ACopyOfARecordThatWasNeverFetchedHasNoPayloadAndNoURL) {
    manager.answer = Dictionary{{"First", "Ann"}};
    record.setDelayedPayloadURL(url, &manager);
    EXPECT_FALSE(record.copy()->payload());
    EXPECT_TRUE(manager.asked.empty());
}

TEST_F(DelayedPayload, IsNotFetchedForArchiving) {
    manager.answer = Dictionary{{"First", "Ann"}};
    record.setPayload(Dictionary{{"stamp", 1}});
    record.setDelayedPayloadURL(url, &manager);
    DictionaryCoder coder;
    record.encodeWithCoder(coder);
    CXDChangeRecord back(coder);
    EXPECT_EQ(back.payload(), Value(Dictionary{{"stamp", 1}}));
    EXPECT_TRUE(manager.asked.empty()) << "neither when written nor after it was read back";
}

} // namespace
} // namespace rolvane
