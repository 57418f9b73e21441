#include "server/mod_cardbook/Reports.h"

#include "server/mod_cardbook/Devices.h"
#include "server/mod_cardbook/Multistatus.h"
#include "server/mod_cardbook/PartialCard.h"
#include "server/mod_cardbook/Properties.h"
#include "server/mod_cardbook/ReportRequest.h"
#include "server/mod_cardbook/XmlText.h"

#include <algorithm>
#include <string_view>

namespace rolvane::cardbook {
namespace {

constexpr size_t kPage = 500;                     // members read at a time
constexpr size_t kMostResponses = 1000000;        // of one answer
constexpr size_t kQueriedBytes = size_t{1} << 30; // of cards that one query reads

class Report {
public:
    Report(Resource resource, const ReportRequest& request, ap_filter_t* output)
        : _resource(std::move(resource)), _library(*_resource.library), _request(request),
          _answer(_resource.r, output) {}

    void deliver() {
        switch (_request.kind) {
        case ReportRequest::Kind::multiget: multiget(); break;
        case ReportRequest::Kind::query: query(); break;
        default: sync();
        }
        _answer.finish();
        noteWhatWasSent();
    }

private:
    const std::string& book() const { return _resource.book->id; }
    std::string pathOfCard(const std::string& name) const { return _resource.path({Place::Kind::card, book(), name}); }
    std::optional<VCardVersion> version() const {
        return _request.data ? std::optional(_request.data->version) : std::nullopt;
    }

    // RFC 6352 section 8.7. Names are looked up page by page, so that the answer begins at once.
    void multiget() {
        _notesEach = sendsWholeCards();
        std::vector<Member> page;
        const auto flush = [&] {
            send(page);
            page.clear();
        };
        for (const std::string& href : _request.hrefs) {
            const auto path = pathOfHref(href);
            const auto place = path ? placeOf(_resource.base, *path) : std::nullopt;
            const bool isHere = place && place->kind == Place::Kind::card && place->book == book();
            auto member = isHere ? _library.memory().named(book(), place->name) : std::nullopt;
            if (!member) {
                const auto left = isHere ? _library.memory().departed(book(), place->name) : std::nullopt;
                if (left) _departed.push_back(*left);
                flush();
                _answer.add("<D:response><D:href>" + xmlText(href) + "</D:href>" + statusLine(HTTP_NOT_FOUND) +
                            "</D:response>\n");
                continue;
            }
            page.push_back(std::move(*member));
            if (page.size() == kPage) flush();
        }
        flush();
    }

    void query() {
        const SqliteSnapshot moment(_library.memory().sqlite());
        const auto asked =
            _request.filter.isEverything() ? version() : std::optional(version().value_or(VCardVersion::v3));
        _notesEach = sendsWholeCards() && (_request.limit || !_request.filter.isEverything());
        uint64_t left = std::min<uint64_t>(_request.limit.value_or(kMostResponses), kMostResponses);
        size_t bytes = 0;
        bool isCut = false;
        const int64_t latest = _library.memory().latest(book());
        forEachPage(0, false, [&](const std::vector<Member>& page) {
            _library.forEachCard(page, asked, [&](const Member& member, const Card* card) {
                if (!card || isCut || !_request.filter.meets(card->text)) return;
                if (left == 0 || (bytes += card->text.size()) > kQueriedBytes) {
                    isCut = true;
                    return;
                }
                --left;
                sendCard(member, *card);
                noteHad(member, *card);
            });
            return !isCut;
        });
        if (isCut)
            _answer.addStatus(_resource.path(), HTTP_INSUFFICIENT_STORAGE, "<D:number-of-matches-within-limits/>");
        else if (_request.filter.isEverything())
            _listedUntil = latest;
        if (_listedUntil && sendsWholeCards()) _sentUntil = latest;
    }

    void sync() {
        BookMemory& memory = _library.memory();
        const SqliteSnapshot moment(memory.sqlite());
        const bool isFirst = _request.token.empty();
        const int64_t from = isFirst ? 0 : numberOfToken(_library, book(), _request.token, refusalOfToken());
        const bool hasFormerOnes = isFirst || Devices(memory).lookedAt(_resource.r->user, book()) >= from;
        _notesEach = sendsWholeCards() && !hasFormerOnes;
        int64_t until = memory.latest(book());
        uint64_t left = std::min<uint64_t>(_request.limit.value_or(kMostResponses), kMostResponses);
        bool isCut = false;
        forEachPage(from, !isFirst, [&](std::vector<Member>& page) {
            if (page.size() > left) {
                page.resize(left);
                isCut = true;
            }
            left -= page.size();
            if (isCut && !page.empty()) until = page.back().sequence;
            if (isCut && page.empty() && _lastSent) until = *_lastSent;
            if (!page.empty()) _lastSent = page.back().sequence;
            send(page);
            return !isCut;
        });
        if (isCut)
            _answer.addStatus(_resource.path(), HTTP_INSUFFICIENT_STORAGE, "<D:number-of-matches-within-limits/>");
        _answer.add("<D:sync-token>" + syncToken(_library, until) + "</D:sync-token>\n");
        _listedUntil = until;
        if (sendsWholeCards() && hasFormerOnes) _sentUntil = until;
    }

    // Thunderbird begins anew after 400 alone. After 403 it would ask with the same token for ever.
    int refusalOfToken() const { return isThunderbird(_resource.r) ? HTTP_BAD_REQUEST : HTTP_FORBIDDEN; }

    template <class Call>
    void forEachPage(int64_t from, bool withGone, Call call) {
        for (;;) {
            std::vector<Member> page = _library.memory().after(book(), from, withGone, kPage);
            if (page.empty()) return;
            from = page.back().sequence;
            const bool isLast = page.size() < kPage;
            if (!call(page) || isLast) return;
        }
    }

    // Those that have left get a 404 (RFC 6578 section 3.5.2).
    void send(const std::vector<Member>& page) {
        std::vector<Member> run;
        const auto flush = [&] {
            _library.forEachCard(run, version(), [&](const Member& member, const Card* card) {
                if (!card) return _answer.addStatus(pathOfCard(member.name), HTTP_NOT_FOUND);
                sendCard(member, *card);
                noteHad(member, *card);
            });
            run.clear();
        };
        for (const Member& member : page) {
            if (!member.gone) {
                run.push_back(member);
                continue;
            }
            flush();
            _answer.addStatus(pathOfCard(member.name), HTTP_NOT_FOUND);
        }
        flush();
    }

    bool sendsWholeCards() const { return _request.data && _request.data->lines.empty(); }

    // A device that is sent a whole book has all of its cards, and needs no note of each.
    void noteHad(const Member& member, const Card& card) {
        if (!_notesEach) return;
        if (!_lookedAt) _lookedAt = Devices(_library.memory()).lookedAt(_resource.r->user, book());
        if (member.sequence > *_lookedAt) _sent.emplace_back(member.uid, card.modified);
    }

    // Behind the last byte: a device whose answer broke off has nothing.
    void noteWhatWasSent() {
        Devices devices(_library.memory());
        if (_sentUntil)
            devices.noteLook(_resource.r->user, book(), *_sentUntil,
                             Date(static_cast<double>(_resource.r->request_time) / 1e6));
        devices.noteHad(_resource.r->user, _sent);
        if (_listedUntil) devices.noteListed(_resource.r->user, book(), *_listedUntil);
        for (const Member& departed : _departed) devices.noteTold(_resource.r->user, book(), departed);
    }

    void sendCard(const Member& member, const Card& card) {
        _resource.place = {Place::Kind::card, book(), member.name};
        _resource.member = member;
        _resource.card = card;
        std::string found, missing;
        if (_request.namesOnly || _request.allProperties)
            for (const PropertyName& name : propertiesOf(_resource))
                found += _request.namesOnly ? emptyElement(name) : propertyElement(_resource, name).value_or("");
        for (const PropertyName& name : _request.properties) {
            if (auto element = propertyElement(_resource, name))
                found += *element;
            else
                missing += emptyElement(name);
        }
        if (_request.data) {
            found += "<C:address-data>";
            appendXml(found, _request.data->lines.empty() ? card.text : partialCard(card.text, _request.data->lines));
            found += "</C:address-data>";
        }
        std::string response = "<D:response><D:href>";
        appendXml(response, escapedPath(_resource.path()));
        response += "</D:href>";
        if (!found.empty() || missing.empty())
            response += "<D:propstat><D:prop>" + found + "</D:prop>" + statusLine(HTTP_OK) + "</D:propstat>";
        if (!missing.empty())
            response += "<D:propstat><D:prop>" + missing + "</D:prop>" + statusLine(HTTP_NOT_FOUND) + "</D:propstat>";
        _answer.add(response + "</D:response>\n");
        _resource.place = {Place::Kind::book, book(), {}};
        _resource.member.reset();
        _resource.card.reset();
    }

    Resource _resource;
    Library& _library;
    const ReportRequest& _request;
    Multistatus _answer;
    std::optional<int64_t> _lastSent, _lookedAt;
    bool _notesEach = false;
    std::optional<int64_t> _sentUntil;            // all cards of the book as it was at that number
    std::vector<std::pair<UniqueId, Date>> _sent; // others
    std::optional<int64_t> _listedUntil;          // who is in the book and who has left, up to that number
    std::vector<Member> _departed;                // others
};

} // namespace

int deliverReport(request_rec* r, const dav_resource* resource, const apr_xml_doc* doc, ap_filter_t* output,
                  dav_error** error) noexcept {
    if (!isOurs(resource)) return DECLINED;
    *error = contained(r, [&] {
        const ReportRequest request = parseReport(doc);
        const Resource& it = of(resource);
        if (request.kind == ReportRequest::Kind::other || it.place.kind != Place::Kind::book || !it.book)
            throw Refused(HTTP_FORBIDDEN, kDavSpace, "supported-report", "There is no such report here.");
        Report(it, request, output).deliver();
    });
    if (*error && r->status == HTTP_MULTI_STATUS) *error = nullptr; // the answer had begun, and was broken off
    return OK;
}

} // namespace rolvane::cardbook
