#pragma once

#include "server/mod_cardbook/Httpd.h"

#include <string>

namespace rolvane::cardbook {

// A 207 answer that goes out while it is made, so that its length costs no memory. Begun with the first response; a
// failure before that can still be answered in another way, one behind it breaks the connection off.
class Multistatus {
public:
    Multistatus(request_rec* r, ap_filter_t* output);
    ~Multistatus();
    Multistatus(const Multistatus&) = delete;
    Multistatus& operator=(const Multistatus&) = delete;

    void add(const std::string& response); // a whole DAV:response, or what else stands there
    void addStatus(const std::string& path, int status, const std::string& error = {}); // a response without properties
    void finish();
    bool hasBegun() const { return _begun; }

private:
    void send(bool last);

    request_rec* _r;
    ap_filter_t* _output;
    apr_bucket_brigade* _brigade;
    std::string _text;
    bool _begun = false, _ended = false;
};

std::string statusLine(int status); // a DAV:status element

} // namespace rolvane::cardbook
