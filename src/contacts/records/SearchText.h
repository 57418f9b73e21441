#pragma once

#include "foundation/Value.h"

#include <string>
#include <string_view>
#include <vector>

namespace rolvane {

// Searching people by words. Each person has a text that is kept with the row; a query is compared with that text.

// Letter case and accents aside: "MÜLLER" and "muller" are one, "ß" is "ss", "æ" is "ae". Other bytes stay.
std::string cxFoldedForSearch(std::string_view utf8);

// A person's text: names, organisation, nickname, mails, phones and note, folded. The digits of each phone stand in it
// once more, without blanks and signs.
std::string cxSearchText(const Dictionary& person);

// A query of words. Any thread; holds no reference to what it was made from.
class CXSearchQuery {
public:
    // Blanks part the words. Neighbours of digits and signs alone ("+49 170", "(0170)", "12-34") are one phone number,
    // or else words like others.
    explicit CXSearchQuery(std::string_view words);

    bool empty() const { return _texts.empty() && _numbers.empty(); } // no word: nobody is meant
    // Is every word in the text, and every number? A number is in it as a part of one of its numbers. With a country's
    // code or zeros before it a number fits the same number with others or without.
    bool fits(std::string_view searchText) const;

private:
    struct Number {
        std::string digits;
        std::vector<std::string> words;
    };
    std::vector<std::string> _texts;
    std::vector<Number> _numbers;
};

} // namespace rolvane
