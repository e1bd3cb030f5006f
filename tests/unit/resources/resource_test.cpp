#include "resources/resource.h"

#include <gtest/gtest.h>

#include "testing/manualclock.h"

namespace {

TEST(OxResourceInvalid, AnswersWithItsStatus) {
    const struct {
        const oxHttpStatus& status;
        const char* extra;
        const char* beginning;
    } cases[] = {
        {Http::UNAUTHORIZED_401, "WWW-Authenticate: Basic\r\n",
         "HTTP/1.0 401 Unauthorized\r\nWWW-Authenticate: Basic\r\nContent-Length: 124\r\n\r\n<html>"},
        {Http::FORBIDDEN_403, nullptr, "HTTP/1.0 403 Forbidden\r\nContent-Length: 138\r\n\r\n<html>"},
        {Http::NOT_FOUND_404, "", "HTTP/1.0 404 Not Found\r\nContent-Length: 140\r\n\r\n<html>"},
    };
    for (const auto& c : cases) {
        const oxRequest request;
        oxResource_Invalid resource(c.status, c.extra);
        const auto reply = resource.GetReply(request);
        EXPECT_EQ(&c.status, &reply->GetStatus());
        EXPECT_EQ(0u, reply->GetContentSize());
        EXPECT_TRUE(reply->ComposeHeader().starts_with(c.beginning)) << reply->ComposeHeader();
    }
}

TEST(OxResourceInvalid, NotModifiedDoesNotSayWhenItExpires) {
    const ManualClock clock;
    const oxRequest request;
    const auto reply = oxResource_Invalid(Http::NOT_MODIFIED_304, nullptr).GetReply(request);
    reply->SetClock(clock);
    EXPECT_EQ(
        "HTTP/1.0 304 Not Modified\r\nDate: Sun, 06 Nov 1994 08:49:37 GMT\r\n"
        "Server: Orvex HTTP Server V3.5c\r\n\r\n",
        reply->ComposeHeader());
}

TEST(OxResourceInvalid, TakesAStatusFromAnywhere) {
    const oxHttpStatus status{423, "423", "Locked", "page"};
    const oxRequest request;
    EXPECT_EQ("HTTP/1.0 423 Locked\r\nContent-Length: 4\r\n\r\npage",
              oxResource_Invalid(status, nullptr).GetReply(request)->ComposeHeader());
}

}  // namespace
