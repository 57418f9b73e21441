#include "contacts/database/SharedForms.h"

#include <algorithm>
#include <bit>

namespace rolvane {
namespace {

constexpr std::string_view kCopy(kCXSubscribedPersonTable), kPlain(kCXPersonTable);
constexpr std::ptrdiff_t kNear = 4; // elements of the known list that are looked at for everybody

bool isCopy(std::string_view person) {
    return person.size() > kCopy.size() && person.ends_with(kCopy) && person[person.size() - kCopy.size() - 1] == ':';
}

} // namespace

UniqueId SharedForms::of(std::string_view person) {
    if (isCopy(person)) {
        _buffer.assign(person.substr(0, person.size() - kCopy.size())).append(kPlain);
        person = _buffer;
    }
    const SharedText* before = find(person);
    return before ? UniqueId(*before) : UniqueId(person);
}

std::vector<UniqueId> SharedForms::of(std::vector<UniqueId> people) {
    for (UniqueId& person : people) {
        if (_next != _end)
            person = of(std::string_view(person.str()));
        else if (isCopy(person.str()))
            person = cxNormalizedUID(person);
    }
    return people;
}

// A longer gap is looked over at the first, the second, the fourth... person who is not found, so all of it together
// costs no more than a few walks over the list.
const SharedText* SharedForms::find(std::string_view shared) {
    const std::ptrdiff_t left = _end - _next;
    const auto stop = _next + (std::has_single_bit(_misses + 1) ? left : std::min(left, kNear));
    const auto found = std::find_if(_next, stop, [&](const Value& known) {
        const SharedText* text = known.textIf();
        return text && text->str() == shared;
    });
    if (found == stop) {
        ++_misses;
        return nullptr;
    }
    _next = found + 1;
    return found->textIf();
}

} // namespace rolvane
