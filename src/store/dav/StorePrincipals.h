#pragma once

#include "foundation/Url.h"
#include "store/http/StoreSession.h"

#include <map>
#include <optional>
#include <string>
#include <vector>

namespace rolvane {

// Account names and what a store calls their principals (RFC 3744 section 2). Made for one answer of the store, which
// names the collections that principals lie in; asks the store for what it does not know. One thread.
class StorePrincipals {
public:
    // `asked` is the endpoint that was asked; hrefs are relative to it. `itself` is what the answer calls that: a
    // server behind what ends TLS writes its inner address, whose hrefs then count by their paths. Those of other
    // origins are not looked at. `collections`: the hrefs of DAV:principal-collection-set.
    StorePrincipals(StoreSession& session, Url asked, const std::string& itself,
                    const std::vector<std::string>& collections);

    // The last component of the principal's path; "" when the href names nobody on this store.
    std::string nameFor(const std::string& href) const;
    // The principal of that name: the one at <collection>/<name>, else one in a collection that is called or displayed
    // so. Where the collections do not answer, <collection>/<name> unseen: the store judges it when the list is set.
    // Nothing when the store knows nobody of the name, or has no collection.
    std::optional<std::string> hrefFor(const std::string& name);
    // Uses this href for the name of the principal there from now on, because the store itself has written it so.
    void learn(const std::string& href);

    // The href as a URL of the same server; nothing for another one's.
    std::optional<Url> resolved(const std::string& href) const;

private:
    enum class Answer { found, notThere, silent };
    Answer lookAt(const Url& place, int depth, const std::string& name, std::string& href);

    StoreSession& _session;
    const Url _asked;
    std::string _innerOrigin; // "" where the server has no other address
    std::vector<Url> _collections;
    std::map<std::string, std::string> _known;
};

} // namespace rolvane
