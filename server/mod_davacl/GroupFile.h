#pragma once

#include <set>
#include <string>
#include <string_view>

namespace rolvane::davacl {

// httpd's own group files, as mod_authz_groupfile reads them: a group a line, "name: user user ...", lines that begin
// with # and empty ones aside. A group that has several lines has the users of all.
std::set<std::string> groupsOf(std::string_view user, std::string_view groupFile);
std::set<std::string> usersIn(std::string_view group, std::string_view groupFile);
std::set<std::string> groupsIn(std::string_view groupFile);

} // namespace rolvane::davacl
