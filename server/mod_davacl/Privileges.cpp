#include "server/mod_davacl/Privileges.h"

#include <iterator>

namespace rolvane::davacl {
namespace {

struct Named {
    unsigned bits;
    const char* name;
    const char* description;
};

// Aggregates first: an element for each whose bits are all there.
constexpr Named kAggregates[] = {
    {kEverything, "all", "Everything"}, {kReading, "read", "Read"}, {kWriting, "write", "Write"}};
constexpr Named kParts[] = {
    {kReadCurrentUserPrivilegeSet, "read-current-user-privilege-set", "Read one's own privileges"},
    {kWriteContent, "write-content", "Write contents"},
    {kWriteProperties, "write-properties", "Write properties"},
    {kBind, "bind", "Add members"},
    {kUnbind, "unbind", "Remove members"},
    {kReadAcl, "read-acl", "Read the access list"},
    {kWriteAcl, "write-acl", "Change the access list"}};

std::string element(const char* name) {
    return std::string("<D:privilege><D:") + name + "/></D:privilege>";
}

std::string supported(const Named& privilege, bool abstract, const std::string& parts = {}) {
    return "<D:supported-privilege>" + element(privilege.name) + (abstract ? "<D:abstract/>" : "") +
           "<D:description xml:lang=\"en\">" + privilege.description + "</D:description>" + parts +
           "</D:supported-privilege>";
}

std::string supportedParts(unsigned of) {
    std::string text;
    for (const Named& part : kParts)
        if (part.bits & of) text += supported(part, true);
    return text;
}

} // namespace

const char* privilegeName(Privilege privilege) {
    if (privilege == kRead) return "read";
    for (const Named& part : kParts)
        if (part.bits == privilege) return part.name;
    return "all";
}

PrivilegeUse useOf(std::string_view name) {
    if (name == "read" || name == "write") return PrivilegeUse::concrete;
    for (const Named& aggregate : kAggregates)
        if (name == aggregate.name) return PrivilegeUse::abstract;
    for (const Named& part : kParts)
        if (name == part.name) return PrivilegeUse::abstract;
    return PrivilegeUse::unknown;
}

std::string privilegeElements(unsigned privileges) {
    std::string text;
    for (const Named& aggregate : kAggregates)
        if ((privileges & aggregate.bits) == aggregate.bits) text += element(aggregate.name);
    for (const Named& part : kParts)
        if (privileges & part.bits) text += element(part.name);
    return text;
}

std::string supportedPrivileges() {
    return supported(kAggregates[0], true,
                     supported(kAggregates[1], false, supportedParts(kReading & ~kRead)) +
                         supported(kAggregates[2], false, supportedParts(kWriting)) +
                         supportedParts(kReadAcl | kWriteAcl));
}

} // namespace rolvane::davacl
