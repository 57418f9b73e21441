#include "conduits/store/EndedPublication.h"

#include "conduits/LocalizedText.h"
#include "contacts/records/Constants.h"
#include "foundation/Preferences.h"
#include "model/PayloadKeys.h"

namespace rolvane {
namespace {

constexpr const char *kDate = "date", *kReplaced = "replaced", *kMayStillRead = "mayStillRead",
                     *kHadOthers = "hadOthers";

// "anna", "anna and bert", "anna, bert and carla".
std::string enumerated(const std::vector<UserName>& names) {
    std::string text;
    for (size_t i = 0; i < names.size(); ++i)
        text += (i == 0 ? "" : i + 1 < names.size() ? ", " : " " + localizedText("AND") + " ") + names[i].str();
    return text;
}

} // namespace

std::optional<EndedPublication> endedPublication(const Preferences& preferences) {
    const Dictionary note = preferences.get(kDaemonDomain, kCXDEndedPublication).dictionary();
    const auto when = note[kDate].date();
    if (!when) return std::nullopt;
    EndedPublication ended{*when, note[kReplaced].boolean(), {}, note[kHadOthers].boolean()};
    for (const Value& name : note[kMayStillRead].array()) ended.mayStillRead.emplace_back(name.string());
    return ended;
}

void noteEndedPublication(Preferences& preferences, const EndedPublication& ended) {
    Array names;
    for (const UserName& name : ended.mayStillRead) names.append(name);
    Dictionary note{{kDate, ended.when}, {kReplaced, ended.replaced}, {kMayStillRead, names}};
    if (ended.hadOthers) note.set(kHadOthers, true);
    preferences.set(kDaemonDomain, kCXDEndedPublication, note);
    preferences.synchronize(kDaemonDomain);
}

UserAlert::Text noticeOf(const EndedPublication& ended) {
    UserAlert::Text text;
    text.header = localizedText("SHARING_ENDED_HEADER");
    text.message = localizedText(ended.hadOthers  ? "SHARING_ENDED_ELSEWHERE"
                                 : ended.replaced ? "SHARING_ENDED_REPLACED"
                                                  : "SHARING_ENDED");
    if (!ended.mayStillRead.empty())
        text.message += " " + localizedText("SHARING_ENDED_RIGHTS", {{"users", enumerated(ended.mayStillRead)}});
    text.defaultButton = localizedText("OK");
    text.icon = "Rolvane";
    return text;
}

Array takenAway(const Dictionary& priorState, const char* property, const Array& listed) {
    Array had;
    for (const auto& [name, group] : priorState)
        had = cxArrayCombinedWithArray(had, group.dictionary()[property].array());
    return cxDifferencesBetweenArray(had, listed)[kDeletions].array();
}

} // namespace rolvane
