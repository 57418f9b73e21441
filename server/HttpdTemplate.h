#pragma once

#include <map>
#include <string>
#include <vector>

namespace rolvane {

// Templates of httpd's configuration, and where they and the modules are.

// The template with that name: share/rolvane beside the program's directory, the source tree, or the install prefix.
// CXException when it is in none of them.
std::string httpdTemplatePath(const std::string& name);

// A module of ours by its file's name: in lib/apache2/modules beside the program's directory, at `built` in the build
// tree, in the install prefix, or among httpd's modules. "" when it is in none of them.
std::string httpdModulePath(const std::string& name, const std::string& built, const std::string& httpdModules);

// Replaces every @NAME@; a name that is not known stays, and httpd complains about it.
std::string filledIn(const std::string& text, const std::map<std::string, std::string>& names);

// The lines, each with its line end.
std::string joinedLines(const std::vector<std::string>& lines);

// CXException when a path holds what a configuration file cannot carry; `service` begins the message ("The store").
void refuseUnsafePath(const std::string& service, const std::string& path);
// The same for a word such as httpd's LogLevel; `kind` says which it is.
void refuseUnsafeWord(const std::string& service, const std::string& kind, const std::string& word);

} // namespace rolvane
