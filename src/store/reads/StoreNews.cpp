#include "store/reads/StoreNews.h"

#include "store/dav/CXDAVManager.h"
#include "store/dav/CXDAVManagerImpl.h"
#include "store/dav/CXDAVNode.h"
#include "store/http/HttpTransport.h"

#include <limits>

namespace rolvane {

namespace {

constexpr size_t kMostTrees = 1000; // that a store takes

std::shared_ptr<const std::string> bodyFor(const std::vector<Url>& places, const std::string& position) {
    std::string text = "<?xml version=\"1.0\" encoding=\"utf-8\"?>\n<R:news xmlns:R=\"http://rolvane.net/ns/\" "
                       "xmlns:D=\"DAV:\">";
    for (const Url& place : places) text += "<D:href>" + CXDAVNode::escaped(place.encodedPath()) + "</D:href>";
    if (!position.empty()) text += "<R:since>" + CXDAVNode::escaped(position) + "</R:since>";
    return std::make_shared<const std::string>(text + "</R:news>");
}

} // namespace

struct StoreNews::Impl {
    Impl(std::vector<size_t> theTrees, Listener toTell)
        : trees(std::move(theTrees)), lines(trees.size()), listener(std::move(toTell)) {}

    bool take(std::string_view bytes) {
        const auto whole = lines.take(bytes);
        if (!whole) return false;
        for (NewsLine line : *whole) {
            begun = true;
            line.tree = trees[line.tree];
            listener.line(std::move(line));
        }
        return true;
    }
    void end(const HttpResponse& answer) const {
        const bool good = answer.complete() && answer.status == 200 && begun;
        const bool refused = answer.complete() && answer.status != 200;
        listener.ended({good || refused ? answer.status : 0, good, answer.detail});
    }

    const std::vector<size_t> trees; // which of those that were named are on the store
    NewsLines lines;                 // the transport's thread, as the next
    bool begun = false;
    const Listener listener;
    std::unique_ptr<CurlTransport> transport; // the last: its thread uses the others
};

StoreNews::StoreNews(std::unique_ptr<Impl> impl) : _impl(std::move(impl)) {}
StoreNews::~StoreNews() = default;

std::unique_ptr<StoreNews> StoreNews::wait(CXDAVManager& client, const std::vector<Url>& trees,
                                           const std::string& position, Listener listener, Limits limits) {
    StoreSession& session = client.impl()->session;
    const auto offer = session.newsOffer();
    if (!offer) return nullptr;
    std::vector<Url> places;
    std::vector<size_t> numbers;
    for (size_t i = 0; i < trees.size() && places.size() < kMostTrees; ++i)
        if (const auto place = session.collectionEndpoint(trees[i])) {
            places.push_back(*place);
            numbers.push_back(i);
        }
    if (places.empty()) return nullptr;
    auto impl = std::make_unique<Impl>(std::move(numbers), std::move(listener));
    impl->transport = session.transportOfItsOwn();
    if (!impl->transport) return nullptr;

    HttpRequest request;
    request.method = "REPORT";
    request.url = offer->place;
    request.headers = {{"Content-Type", "application/xml; charset=utf-8"}, {"Depth", "0"}};
    request.body = bodyFor(places, position.empty() ? offer->firstPosition : position);
    request.limits.totalSeconds = limits.longestSeconds;
    request.limits.idleSeconds = limits.silentSeconds;
    request.limits.maxBodyBytes = std::numeric_limits<size_t>::max();
    request.sinkStatus = 200;
    request.sink = [made = impl.get()](std::string_view bytes) { return made->take(bytes); };
    CurlTransport& transport = *impl->transport;
    transport.start(std::move(request), [made = impl.get()](const HttpResponse& answer) { made->end(answer); });
    return std::unique_ptr<StoreNews>(new StoreNews(std::move(impl)));
}

} // namespace rolvane
