#include "Shares.h"

#include "Publication.h"

#include "contacts/records/Constants.h"
#include "contacts/records/SharingDates.h"
#include "foundation/Date.h"

#include <algorithm>

namespace rolvane::cli {

namespace {

constexpr const char* kLists[] = {kCXReadSharingACLProperty, kCXReadWriteSharingACLProperty};

bool contains(const std::vector<std::string>& list, const std::string& name) {
    return std::find(list.begin(), list.end(), name) != list.end();
}

const char* datesOf(std::string_view list) {
    return list == kCXReadSharingACLProperty ? kCXReadSharingDatesProperty : kCXReadWriteSharingDatesProperty;
}

// An empty list is none.
bool store(CXAllGroup& group, const CXMultiValue& list, const char* property) {
    if (!list.empty()) return group.setValue(list, property);
    return group.valueForProperty(property) && group.removeValueForProperty(property);
}

} // namespace

std::vector<std::string> Shares::listed(const char* property) const {
    std::vector<std::string> names;
    if (const auto list = _database.allGroup()->multiValueForProperty(property))
        for (const CXMultiValue::Entry& entry : list->entries())
            if (!contains(names, entry.value.string())) names.push_back(entry.value.string());
    return names;
}

std::vector<std::string> Shares::readers() const {
    std::vector<std::string> all = listed(kCXReadSharingACLProperty);
    for (const std::string& writer : writers())
        if (!contains(all, writer)) all.push_back(writer);
    return all;
}

std::vector<std::string> Shares::writers() const {
    return listed(kCXReadWriteSharingACLProperty);
}

bool Shares::mayRead(const std::string& user) const {
    return contains(readers(), user);
}

bool Shares::mayWrite(const std::string& user) const {
    return contains(writers(), user);
}

bool Shares::put(const char* property, const std::string& user, bool wanted) {
    if (contains(listed(property), user) == wanted) return false;
    CXMutableMultiValue list;
    if (const auto held = _database.allGroup()->multiValueForProperty(property)) list = CXMutableMultiValue(*held);
    if (wanted) {
        list.addValue(user, user);
    } else {
        for (size_t i = list.count(); i-- > 0;)
            if (list.valueAtIndex(i).string() == user) list.removeAtIndex(i);
    }
    putDate(datesOf(property), user, wanted);
    return store(*_database.allGroup(), list, property);
}

void Shares::putDate(const char* property, const std::string& user, bool wanted) {
    CXMutableMultiValue dates;
    if (const auto held = _database.allGroup()->multiValueForProperty(property)) dates = CXMutableMultiValue(*held);
    for (size_t i = dates.count(); i-- > 0;)
        if (dates.labelAtIndex(i) == user) dates.removeAtIndex(i);
    if (wanted) dates.addValue(Clock::system().now(), user);
    store(*_database.allGroup(), dates, property);
}

std::optional<Date> Shares::since(const char* property, const std::string& user) const {
    if (const auto dates = _database.allGroup()->multiValueForProperty(property))
        for (const CXMultiValue::Entry& entry : dates->entries())
            if (entry.label == user) return entry.value.date();
    return std::nullopt;
}

std::optional<Date> Shares::readsSince(const std::string& user) const {
    return mayRead(user) ? since(kCXReadSharingDatesProperty, user) : std::nullopt;
}

std::optional<Date> Shares::writesSince(const std::string& user) const {
    return mayWrite(user) ? since(kCXReadWriteSharingDatesProperty, user) : std::nullopt;
}

bool Shares::grant(const std::string& user, bool write) {
    const bool reads = put(kCXReadSharingACLProperty, user, true);
    const bool writes = put(kCXReadWriteSharingACLProperty, user, write);
    settle();
    return reads || writes;
}

bool Shares::deny(const std::string& user) {
    const bool writes = put(kCXReadWriteSharingACLProperty, user, false);
    const bool reads = put(kCXReadSharingACLProperty, user, false);
    settle();
    return reads || writes;
}

void Shares::denyAll() {
    for (const std::string& user : readers()) deny(user);
}

void Shares::settle() {
    const Publication publication(_database);
    if (publication.everything()) return;
    const CXAllGroupRef all = _database.allGroup();
    for (const CXGroupRef& group : publication.groups())
        for (const char* list : kLists)
            if (const Value wanted = all->valueForProperty(list); wanted != group->valueForProperty(list)) {
                if (wanted)
                    group->setValue(wanted, list);
                else
                    group->removeValueForProperty(list);
            }
}

} // namespace rolvane::cli
