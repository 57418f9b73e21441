#include "store/http/ExpectedAnswer.h"

#include "store/dav/Multistatus.h"
#include "store/http/StoreSession.h"

#include <algorithm>
#include <array>
#include <strings.h>

namespace rolvane {

namespace {

bool containsNoCase(std::string_view text, std::string_view wanted) {
    return std::search(text.begin(), text.end(), wanted.begin(), wanted.end(), [](char a, char b) {
               return tolower(static_cast<unsigned char>(a)) == tolower(static_cast<unsigned char>(b));
           }) != text.end();
}

enum class Method { options, propfind, read, put, remove, mkcol, transfer, lock, unlock, acl, other };

Method methodOf(std::string_view name) {
    static constexpr std::array<std::pair<std::string_view, Method>, 13> kMethods{{{"OPTIONS", Method::options},
                                                                                   {"PROPFIND", Method::propfind},
                                                                                   {"REPORT", Method::propfind},
                                                                                   {"GET", Method::read},
                                                                                   {"HEAD", Method::read},
                                                                                   {"PUT", Method::put},
                                                                                   {"DELETE", Method::remove},
                                                                                   {"MKCOL", Method::mkcol},
                                                                                   {"COPY", Method::transfer},
                                                                                   {"MOVE", Method::transfer},
                                                                                   {"LOCK", Method::lock},
                                                                                   {"UNLOCK", Method::unlock},
                                                                                   {"ACL", Method::acl}}};
    for (const auto& [known, method] : kMethods)
        if (known == name) return method;
    return Method::other;
}

bool isGrave(Method method, int status) {
    if (status < 400) return true;
    switch (method) {
    case Method::options:
    case Method::propfind:
    case Method::read: return false;
    case Method::put: return status != 412 && status != 423;   // another version is read first
    case Method::mkcol: return status != 405 && status != 423; // what is in the way is looked at
    default: return status != 423;
    }
}

AnswerVerdict onError(Method method, int status) {
    switch (status) {
    case 407: // a proxy's
    case 511: // a portal's (RFC 6585 section 6)
        return AnswerVerdict::foreign;
    case 401:
    case 408:
    case 429: return AnswerVerdict::failure;
    default: break;
    }
    if (status >= 500 && status != 501) return AnswerVerdict::failure;
    return isGrave(method, status) ? AnswerVerdict::graveRefusal : AnswerVerdict::refusal;
}

AnswerVerdict onRead(const HttpResponse& answer) {
    if (answer.status != 200) return AnswerVerdict::foreign;
    return isWebPage(answer) ? AnswerVerdict::needsProof : AnswerVerdict::success;
}

AnswerVerdict onLock(const HttpResponse& answer) {
    const bool grants = (answer.status == 200 || answer.status == 201) && containsNoCase(answer.body, "activelock");
    return grants && !isWebPage(answer) ? AnswerVerdict::success : AnswerVerdict::foreign;
}

AnswerVerdict onPropfind(const HttpResponse& answer) {
    const bool hasBody = answer.status == 207 || (answer.status == 200 && containsNoCase(answer.body, "multistatus"));
    return hasBody && !isWebPage(answer) ? AnswerVerdict::success : AnswerVerdict::foreign;
}

// `done`: the statuses that say so beyond doubt.
AnswerVerdict onWrite(int status, std::initializer_list<int> done, AnswerVerdict otherwise) {
    if (status == 207) return AnswerVerdict::failure;
    return std::find(done.begin(), done.end(), status) != done.end() ? AnswerVerdict::success : otherwise;
}

AnswerVerdict onDelete(const HttpResponse& answer) {
    if (answer.status == 207 && namesNoFailure(answer)) return AnswerVerdict::success;
    return onWrite(answer.status, {204}, AnswerVerdict::needsProof);
}

} // namespace

bool namesNoFailure(const HttpResponse& multistatus) {
    MultistatusReader reader;
    const auto entries = reader.feed(multistatus.body) ? reader.finish() : std::nullopt;
    return entries && !entries->empty() &&
           std::all_of(entries->begin(), entries->end(), [](const MultistatusEntry& entry) {
               return (entry.status >= 200 && entry.status < 300) || entry.status == 404;
           });
}

bool isWebPage(const HttpResponse& answer) {
    if (const std::string* type = answer.header("content-type"); type && !type->empty())
        return containsNoCase(*type, "html");
    return containsNoCase(std::string_view(answer.body).substr(0, 512), "<html");
}

AnswerVerdict verdictOn(std::string_view method, const HttpResponse& answer) {
    if (!answer.complete()) return AnswerVerdict::failure;
    const int status = answer.status;
    if (status < 200) return AnswerVerdict::foreign;
    if (status >= 300) return onError(methodOf(method), status);
    switch (methodOf(method)) {
    case Method::options: return announcesDav(answer) ? AnswerVerdict::success : AnswerVerdict::foreign;
    case Method::propfind: return onPropfind(answer);
    case Method::read: return onRead(answer);
    case Method::put: return onWrite(status, {201, 204}, AnswerVerdict::needsProof);
    case Method::remove: return onDelete(answer);
    case Method::mkcol: return onWrite(status, {201}, AnswerVerdict::needsProof);
    case Method::transfer: return onWrite(status, {201, 204}, AnswerVerdict::foreign);
    case Method::lock: return onLock(answer);
    case Method::unlock:
        if (status == 207) return AnswerVerdict::foreign;
        return status == 204 ? AnswerVerdict::success : AnswerVerdict::needsProof;
    case Method::acl:
        return isWebPage(answer) ? AnswerVerdict::foreign : onWrite(status, {200, 201, 204}, AnswerVerdict::foreign);
    case Method::other: break;
    }
    return AnswerVerdict::foreign;
}

std::string accountOf(std::string_view method, const HttpResponse& answer) {
    const std::string* target = answer.status < 400 ? answer.header("location") : nullptr;
    return std::string(method) + " was answered with " + std::to_string(answer.status) +
           (isWebPage(answer) ? " and a web page" : "") +
           (answer.status >= 300 && target ? ", which sends to " + *target : "");
}

} // namespace rolvane
