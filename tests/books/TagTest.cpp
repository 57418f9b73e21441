#include "contacts/database/Journal.h"
#include "foundation/Notification.h"
#include "server/mod_cardbook/CardWriter.h"
#include "server/mod_cardbook/Devices.h"
#include "support/TempHome.h"

#include <functional>
#include <gtest/gtest.h>
#include <utility>

// A tag that a write is answered with stands for the card that was sent, whatever others save at the same moment.

namespace rolvane {
namespace {

using namespace cardbook;

// Hears of a save before anybody else does, and lets another program save at once.
class SaveBehind : public DistributedNotifications {
public:
    std::function<void()> saves;

    bool post(const Notification&) override {
        if (const auto save = std::exchange(saves, nullptr)) save();
        return true;
    }
    [[nodiscard]] ObservationHandle observe(std::string, NotificationHandler, bool) override { return {}; }
    void setSuspended(bool) override {}
    bool connected() const override { return true; }
};

class Tags : public testing::Test {
protected:
    Written put(const std::string& name, const std::string& text) {
        library.catchUp();
        const Book book = *library.book(std::string(kContactsBook));
        Conditions conditions;
        conditions.namesTag = true;
        return CardWriter(library, {book, name, "/books", "laptop", conditions, library.memory().named(book.id, name)})
            .put(text);
    }
    Card served(const std::string& name) {
        library.catchUp();
        return *library.card(*library.memory().named(kContactsBook, name), std::nullopt);
    }
    static std::string card(const std::string& lines) {
        return "BEGIN:VCARD\r\nVERSION:4.0\r\nUID:urn:uuid:6F0C1B2A-8B7E-4B53-9B7E-0B8C3D1E2F3A\r\n" + lines +
               "END:VCARD\r\n";
    }
    void setBehind(const std::string& uid, const char* property) {
        behind.saves = [this, uid, property] {
            other.recordForUniqueId(UniqueId(uid))->setValue("by another program", property);
            ASSERT_TRUE(other.save());
        };
    }
    static CXRolvane::Options otherProgram(const std::string& path) {
        CXRolvane::Options chosen;
        chosen.path = path;
        chosen.program = "other";
        return chosen;
    }

    test::TempDirectory directory;
    CXRolvane other{otherProgram(directory / "contacts.db")};
    SaveBehind behind;
    Library library{directory / "contacts.db", &behind};
};

// A client that got the other version's tag would never ask for that version.
TEST_F(Tags, OfAPersonThatAnotherProgramSavesBehindAreThoseOfTheCardThatWasSent) {
    const std::string uid = "6F0C1B2A-8B7E-4B53-9B7E-0B8C3D1E2F3A:CXPerson";
    const Written made = put("ann.vcf", card("FN:Ann\r\nN:;Ann;;;\r\n"));
    EXPECT_EQ(made.tag, served("ann.vcf").tag) << "nobody else has saved";
    setBehind(uid, kCXNoteProperty);
    const Written written = put("ann.vcf", card("FN:Ann\r\nN:;Ann;;;\r\nTITLE:Cook\r\n"));
    const Card now = served("ann.vcf");
    ASSERT_NE(now.text.find("by another program"), std::string::npos) << "it did save";
    EXPECT_NE(written.tag, "");
    EXPECT_NE(written.tag, made.tag);
    EXPECT_NE(written.tag, now.tag) << "the client would take the other program's version for the one that it sent";
    // The device has had its own version, not the other one: what it writes without a tag is merged with that.
    EXPECT_FALSE(Devices(library.memory()).had("laptop", std::string(kContactsBook), now.member).isPresent);
    const Written same = put("ann.vcf", now.text);
    EXPECT_EQ(same.tag, now.tag) << "nothing was changed, so the tag stays";
}

TEST_F(Tags, OfAGroupThatAnotherProgramSavesBehindAreThoseOfTheCardThatWasSent) {
    const std::string uid = "6F0C1B2A-8B7E-4B53-9B7E-0B8C3D1E2F3A:CXGroup", kind = "KIND:group\r\n";
    const Written made = put("g.vcf", card(kind + "FN:Friends\r\n"));
    EXPECT_EQ(made.tag, served("g.vcf").tag) << "nobody else has saved";
    setBehind(uid, kCXGroupNameProperty);
    const Written written = put("g.vcf", card(kind + "FN:Pals\r\n"));
    const Card now = served("g.vcf");
    ASSERT_NE(now.text.find("by another program"), std::string::npos) << "it did save";
    EXPECT_NE(written.tag, "");
    EXPECT_NE(written.tag, made.tag);
    EXPECT_NE(written.tag, now.tag) << "the client would take the other program's version for the one that it sent";
}

} // namespace
} // namespace rolvane
