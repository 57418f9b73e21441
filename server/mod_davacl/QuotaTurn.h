#pragma once

#include "server/mod_davacl/Configuration.h"
#include "server/mod_davacl/Quota.h"
#include "server/mod_davacl/TreePath.h"

#include <map>
#include <memory>
#include <optional>
#include <string>
#include <vector>

namespace rolvane::davacl {

// When the configuration has been read: trees are counted anew once for each time.
void prepareQuotas();

// The room that one request takes in the trees. Where the host keeps no quotas every call says yes and does nothing.
// It belongs to one request.
//
// The owner of a tree pays for it, whoever writes there. The places are measured before and after the change, with the
// owners' ledgers locked in between. For an upload this time begins with its last byte, so slow clients block nobody.
class QuotaTurn {
public:
    struct Place {
        TreePath tree;
        std::string path; // on the disk, without a slash at its end
        bool collection = false;
    };
    QuotaTurn() = default;
    QuotaTurn(request_rec* r, const Configuration& c, std::optional<Place> source, std::optional<Place> destination);
    ~QuotaTurn() { end(); }
    QuotaTurn(const QuotaTurn&) = delete;

    // Whether what the request announces has room; without locks, before a byte of its body is read.
    bool mayBegin();
    // Whether so many bytes of the body are still within what `mayBegin` saw.
    bool allows(uint64_t received) const { return received <= _most; }
    // Takes the locks, and measures. False when there is no room, and then nothing is locked.
    bool begin(uint64_t received);
    // Measures again, counts the difference and gives the locks back. Nothing when `begin` was not called.
    void end();

private:
    struct Measured {
        std::string owner;
        bool deep = false;
        uint64_t before = 0;
    };
    void measure(const Place& place);
    int64_t growth(uint64_t received) const;
    uint64_t roomOfSource() const;
    bool hasRoom(uint64_t used, int64_t more) const;
    const Place* payer() const { return _destination ? &*_destination : _source ? &*_source : nullptr; }

    request_rec* _r = nullptr; // null: no quotas here
    const Configuration* _c = nullptr;
    std::optional<Place> _source, _destination;
    uint64_t _most = UINT64_MAX;                                  // bytes of a body
    std::map<std::string, std::unique_ptr<QuotaLedger>> _ledgers; // by owner
    std::map<std::string, Measured> _places;                      // by path
};

// The place of a request, or of one that looked a Destination up, on the disk.
std::optional<QuotaTurn::Place> quotaPlaceOf(const request_rec* r, const std::optional<TreePath>& place);

// The answer to a request for which there is no room (RFC 4331 section 6).
int refuseForRoom(request_rec* r);

// The values of DAV:quota-used-bytes and DAV:quota-available-bytes; nothing where no quota is kept.
struct QuotaFigures {
    uint64_t used = 0;
    std::optional<uint64_t> available; // nothing: as much as the disk holds
};
std::optional<QuotaFigures> quotaFiguresOf(request_rec* r, const Configuration& c, const QuotaTurn::Place& place);

} // namespace rolvane::davacl
