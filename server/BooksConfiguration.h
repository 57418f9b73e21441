#pragma once

#include "foundation/Value.h"
#include "server/BooksServer.h"

#include <map>
#include <string>

namespace rolvane {

// Texts for a server of address books: pure, but for the template that is read.

// Where mod_cardbook.so is, as storeAccessModulePath finds the other module; "" when it is nowhere.
std::string booksModulePath(const std::string& httpdModules);

// The whole configuration. `inner` is the port that httpd has behind a socket unit; 0: it listens on `port` itself.
// CXException when a path or an address holds what a configuration file cannot carry, or a module is missing.
std::string renderBooksConfiguration(const BooksOptions& options, int port, int inner, bool withIPv6);

// Unit files of the user's systemd by name: rolvane-books.socket keeps the port, rolvane-books.service hands
// connections on, rolvane-books-httpd.service is httpd, which ends ten minutes after the last connection.
std::map<std::string, std::string> renderBooksUnits(const BooksOptions& options, int port, int inner, bool withIPv6);

// The values of books.plist, kept from one start to the next, and back. Missing keys take defaults.
Dictionary booksOptionsToDictionary(const BooksOptions& options, int port, int inner);
BooksOptions booksOptionsFromDictionary(const Dictionary& dictionary);

} // namespace rolvane
