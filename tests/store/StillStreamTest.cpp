#include "Http2Server.h"
#include "store/http/HttpTransport.h"
#include "support/TempHome.h"

#include <gtest/gtest.h>

namespace rolvane {
namespace {

using namespace test;

TEST(StillStream, WhoseEndTheServerForgetsIsEndedByASmallRequestOfOurOwn) {
    const TempDirectory directory;
    // Sends the whole body of the first answer at once, and the end of that stream only when another request arrives.
    uint32_t first = 0;
    Http2Server server(directory / "ca.pem", [&](Http2Server::Connection& connection, uint32_t stream) {
        if (connection.requests == 1) {
            first = stream;
            connection.send(Http2Server::headers, Http2Server::endHeaders, stream, "\x88");
            return connection.send(Http2Server::data, Http2Server::none, stream, "the whole body");
        }
        connection.sendOk(stream);
        connection.send(Http2Server::data, Http2Server::endStream, first);
    });
    HttpResponse answer;
    {
        CurlTransportOptions options;
        options.caFile = directory / "ca.pem";

        CurlTransport transport(options);
        HttpRequest request;
        request.method = "GET";
        request.url = Url(server.origin() + "/listing");
        request.limits.idleSeconds = 20;
        answer = transport.perform(std::move(request));
    }
    EXPECT_EQ(answer.status, 200) << answer.detail;
    EXPECT_EQ(answer.body, "the whole body");
    EXPECT_EQ(server.requests(), 2);
}

} // namespace
} // namespace rolvane
