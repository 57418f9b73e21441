#pragma once

#include "server/mod_cardbook/ReportRequest.h"

namespace rolvane::cardbook {

// The named lines of a card's text, with those that make it a card (RFC 6352 section 10.4.2). Pure.
std::string partialCard(const std::string& card, const std::vector<AddressData::Line>& lines);

} // namespace rolvane::cardbook
