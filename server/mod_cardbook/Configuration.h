#pragma once

#include "server/mod_cardbook/Httpd.h"

namespace rolvane::cardbook {

// The values of a server's directives; in the configuration's pool.
//   CardBookDatabase PATH     the contact database
//   CardBookMaxCard BYTES     the most that a card may have; 32 MB otherwise
//   CardBookMaxReport BYTES   the most that the body of a request that is no card may have; 16 MB otherwise
struct Configuration {
    const char* database = nullptr;
    apr_off_t maxCard = 0, maxReport = 0; // 0: not said

    apr_off_t cardBytes() const { return maxCard ? maxCard : apr_off_t{32} << 20; }
    apr_off_t reportBytes() const { return maxReport ? maxReport : apr_off_t{16} << 20; }
};

const Configuration& configurationOf(const request_rec* r);
// Whether the request is for the books ("Dav cardbook").
bool servesBooks(request_rec* r);

void* createConfiguration(apr_pool_t* pool, server_rec* server);
void* mergeConfigurations(apr_pool_t* pool, void* base, void* more);
extern const command_rec kDirectives[];

} // namespace rolvane::cardbook
