#pragma once

#include "foundation/Date.h"
#include "foundation/Utf8.h"
#include "store/dav/Multistatus.h"
#include "store/http/ExpectedAnswer.h"
#include "store/http/HttpTransport.h"
#include "store/http/RequestFailures.h"
#include "store/locks/LockAnswers.h"

#include <cmath>
#include <cstdint>
#include <ctime>
#include <stdexcept>
#include <string>
#include <string_view>

namespace rolvane::fuzz {

// The C library's reading of a fixed date, which must be the text's only one: whole fields of the right day of week.
inline std::optional<double> fixedDateByTheLibrary(const std::string& text) {
    std::tm parts{};
    const char* end = strptime(text.c_str(), "%a, %d %b %Y %H:%M:%S GMT", &parts);
    if (!end || *end || text.size() != 29 || text.find('\0') != std::string::npos) return std::nullopt;
    const std::time_t time = timegm(&parts);
    char again[64];
    std::tm back{};
    gmtime_r(&time, &back);
    if (std::strftime(again, sizeof again, "%a, %d %b %Y %H:%M:%S GMT", &back) == 0 || text != again)
        return std::nullopt;
    return static_cast<double>(time);
}

inline void checkDates(const std::string& text) {
    const auto http = Date::fromHTTP(text);
    if (const auto expected = fixedDateByTheLibrary(text))
        if (!http || http->secondsSince1970() != *expected) throw std::logic_error("a fixed date reads as another one");
    for (const auto& date : {http, Date::fromISO8601(text)}) {
        if (!date) continue;
        if (!date->isRepresentable()) throw std::logic_error("a date was read that cannot be said");
        const double whole = std::floor(date->secondsSince1970());
        const auto again = Date::fromHTTP(date->toHTTP()), iso = Date::fromISO8601(date->toISO8601());
        if (!again || again->secondsSince1970() != whole || !iso || iso->secondsSince1970() != whole)
            throw std::logic_error("a date that was written reads back as another one");
    }
}

inline void checkWords(const HttpResponse& answer) {
    const std::string words = serverWords(answer);
    if (words.size() > 200 || !isUtf8(words)) throw std::logic_error("the server's words are too long or no UTF-8");
    for (std::string_view rest = words; !rest.empty();) {
        const auto point = takeCodePoint(rest);
        if (!point || *point < 0x20 || (*point >= 0x7f && *point < 0xa0) || (*point >= 0x202a && *point <= 0x202e) ||
            (*point >= 0x2066 && *point <= 0x2069) || *point == 0x2028 || *point == 0x2029)
            throw std::logic_error("the server's words hold a control character");
    }
}

// The first line is a method and a status, lines up to an empty one are headers, the rest is the body: whatever they
// are, they are judged without a fault, by one table, and what a person gets to see of them is one plain line.
inline void checkAnswerHead(const uint8_t* data, size_t size) {
    std::string_view rest(reinterpret_cast<const char*>(data), size);
    const auto line = [&rest] {
        const size_t end = std::min(rest.find('\n'), rest.size());
        const std::string text(rest.substr(0, end));
        rest.remove_prefix(std::min(end + 1, rest.size()));
        return text;
    };
    const std::string first = line();
    const size_t space = std::min(first.find(' '), first.size());
    HttpResponse answer;
    for (const char c : first.substr(space))
        if (c >= '0' && c <= '9' && answer.status < 100) answer.status = answer.status * 10 + (c - '0');
    if (answer.status == 0) answer.error = TransportError::unreachable;
    for (std::string header = line(); !header.empty(); header = line()) {
        const size_t colon = header.find(": ");
        if (colon == std::string::npos) continue;
        std::string name = header.substr(0, colon);
        for (char& c : name)
            if (c >= 'A' && c <= 'Z') c = static_cast<char>(c - 'A' + 'a');
        answer.headers.emplace_back(name, header.substr(colon + 2));
        checkDates(answer.headers.back().second);
    }
    answer.body = std::string(rest);
    checkDates(first);
    checkWords(answer);

    const AnswerVerdict verdict = verdictOn(first.substr(0, space), answer);
    if (verdict == AnswerVerdict::success && (answer.status < 200 || answer.status > 299))
        throw std::logic_error("an answer that is no success counts as one");
    if (verdict == AnswerVerdict::success && isWebPage(answer) && first.substr(0, space) == "PROPFIND")
        throw std::logic_error("a web page counts as a listing");
    if (!isUtf8(accountOf(first.substr(0, space), answer)) && isUtf8(first))
        throw std::logic_error("the account of an answer is no UTF-8");
    if (judgeLockAnswer(answer) == LockAnswer::granted && !parseLockAnswer(answer.body))
        throw std::logic_error("a lock was granted of which nothing tells");
    if (const auto seconds = retryAfterSeconds(answer, Date(1e9)))
        if (!(*seconds >= 0 && *seconds <= 1e6)) throw std::logic_error("a wait without measure");
}

} // namespace rolvane::fuzz
