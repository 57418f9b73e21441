// The passes by which a subscription's people arrive, ended before any of their writes: nothing of what had come until
// then may be taken for the subscriber's own doing afterwards.

#include "TwoUsers.h"
#include "Writes.h"
#include "foundation/CXException.h"

namespace rolvane::test {
namespace {

// Nothing reaches the disk from the given write on.
class DiskEndsBeforeWrite {
public:
    explicit DiskEndsBeforeWrite(int write) {
        left = write;
        interceptWrites([] { return left-- > 0; });
    }
    ~DiskEndsBeforeWrite() { interceptWrites(nullptr); }
    DiskEndsBeforeWrite(const DiskEndsBeforeWrite&) = delete;
    DiskEndsBeforeWrite& operator=(const DiskEndsBeforeWrite&) = delete;
    static std::atomic<int> left;
};
std::atomic<int> DiskEndsBeforeWrite::left = 0;

} // namespace

class SubscriberCrash : public TwoUsers {
protected:
    // Whatever the publisher takes away between the crash and the next pass.
    void changeMuch(int number) {
        alice.application->removeRecord(alice.application->recordForUniqueId(people.front()->uniqueId()));
        people.erase(people.begin());
        people.push_back(alice.add("New " + std::to_string(number)));
        alice.application->removeRecord(alice.application->recordForUniqueId(circle->uniqueId()));
        alice.application->save();
        friends->setValue(Value("Friends " + std::to_string(number)), kCXGroupNameProperty);
        const auto member = std::dynamic_pointer_cast<CXPerson>(
            alice.application->recordForUniqueId(friends->memberUniqueIds().front()));
        friends->removeMember(member);
        friends->addMember(people.back());
        alice.application->save();
        alice.pass();
    }
    void expectBobFollows(int write) {
        circle = alice.group("Circle", {people[0], people[1]});
        alice.pass();
        Participant killed(*world, "bob");
        killed.subscribe(alice);
        killed.engine.reset();
        {
            const DiskEndsBeforeWrite end(write);
            try {
                killed.pass();
            } catch (const CXException&) { // so it ends
            }
        }
        next = std::make_unique<Participant>(*world, "bob", killed.directory.path());
        changeMuch(write);
        const auto wanted = alice.view();
        next->pass();
        next->pass();
        EXPECT_EQ(next->view(alice.base), wanted) << log.text();
        alice.pass();
        EXPECT_EQ(alice.view(), wanted) << "what she took away came back\n" << log.text();
    }
    CXGroupRef circle;
    std::unique_ptr<Participant> next;
};

TEST_F(SubscriberCrash, BeforeAnyWriteOfTheFirstPassBringsNothingBackThatThePublisherTakesAway) {
    constexpr int kEnough = 1 << 20, kCrashes = 20;
    expectBobFollows(kEnough);
    const int writes = kEnough - DiskEndsBeforeWrite::left;
    ASSERT_GT(writes, kCrashes);
    for (int crash = 0; crash < kCrashes && !HasFailure(); ++crash) {
        const int write = writes * crash / kCrashes;
        SCOPED_TRACE("nothing was written from write " + std::to_string(write) + " of " + std::to_string(writes));
        expectBobFollows(write);
    }
}

} // namespace rolvane::test
