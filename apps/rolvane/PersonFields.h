#pragma once

#include "contacts/records/CXPerson.h"

#include <CLI/CLI.hpp>
#include <string>
#include <vector>

namespace rolvane::cli {

// The options of `add` and `edit`, and what they do to a person.
struct PersonFields {
    // Option name and property of the single strings, in the order of the help text.
    struct Single {
        const char *option, *property, *help;
    };
    static const std::vector<Single>& singles();

    std::vector<std::string> values; // one a single, "" when the option was not given
    std::vector<CLI::Option*> given;
    std::string birthday, photo;
    std::vector<std::string> phones, emails, urls, addresses;                             // "label:value"
    std::vector<std::string> removedPhones, removedEmails, removedUrls, removedAddresses; // value or identifier
    std::vector<std::string> unset;                                                       // property names

    void declare(CLI::App& command, bool editing);
    // Changes the person. Throws CommandError when a value cannot be understood; the person is then unchanged.
    void applyTo(CXPerson& person) const;
};

} // namespace rolvane::cli
