#pragma once

#include "Context.h"

#include "server/BooksServer.h"

namespace rolvane::cli {

// The server of this user's address books as it was switched on last; with defaults when it never was.
BooksOptions knownBooks(const std::string& directory = "");

// For `rolvane status`: whether the books are on, where, for how many devices, and how the link with another server is.
nlohmann::ordered_json booksJson();
std::string booksText(const nlohmann::ordered_json& books); // "" when they were never on

// How the links with other servers are, and one of them as a line of text.
nlohmann::ordered_json linksJson(const BooksOptions& books);
std::string linkText(const nlohmann::ordered_json& link);

void addBooksLinkCommands(CLI::App& books, Context& context); // books link unlink sync

} // namespace rolvane::cli
