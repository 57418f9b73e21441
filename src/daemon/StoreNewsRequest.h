#pragma once

#include "daemon/NewsWatch.h"
#include "foundation/RunLoop.h"

namespace rolvane {

class CXDAVManager;

// A request for news at the account's store, whose lines are told on the loop's thread, behind whatever it is doing.
class StoreNewsRequest : public NewsWatch::Request {
public:
    // Null where StoreNews::wait gives none.
    static std::unique_ptr<NewsWatch::Request> open(RunLoop& loop, CXDAVManager& client, const std::vector<Url>& trees,
                                                    const std::string& position, NewsWatch::Listener listener,
                                                    StoreNews::Limits limits = {});
    ~StoreNewsRequest() override;
    StoreNewsRequest(const StoreNewsRequest&) = delete;
    StoreNewsRequest& operator=(const StoreNewsRequest&) = delete;

private:
    struct Inbox;
    explicit StoreNewsRequest(NewsWatch::Listener listener);
    void tell();

    const std::shared_ptr<Inbox> _inbox;
    const std::shared_ptr<NewsWatch::Listener> _listener; // it may end this object
    RunLoop::Handle _port;
    std::unique_ptr<StoreNews> _news; // goes first: its thread fills the inbox
};

} // namespace rolvane
