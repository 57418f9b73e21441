#pragma once

#include <string>
#include <vector>

namespace rolvane::cli {

// Those of the candidates that somebody may have meant who wrote `written`: they, or one of their words, differ by a
// few letters. The nearest ones first, three at most. Letter case and accents do not matter. A pure function.
std::vector<std::string> suggestions(const std::string& written, const std::vector<std::string>& candidates);

// " Did you mean "publish" or "unpublish"?", "" for none.
std::string didYouMean(const std::vector<std::string>& suggested);

} // namespace rolvane::cli
