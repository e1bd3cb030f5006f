// Requests that arrive in pieces: reading and taking apart must not depend on where they are cut.
//
// The first two bytes of the input say how, the others are the request.
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <memory>
#include <string>
#include <string_view>
#include <vector>

#include "../unit/protocol/testsockets.h"
#include "protocol/request.h"

namespace {

constexpr std::size_t CUT_BYTES = 2;
constexpr std::size_t MAX_PIECES = 100;  // as many as a socket holds before they are read
constexpr std::size_t MAX_TEXT = 80000;  // likewise
constexpr std::size_t INLINE_LIMIT = oxRequestLimits::INLINE_BUFFER - 1;

void Check(bool holds) {
    if (!holds)
        std::abort();
}

struct Outcome {
    bool good;
    int status;
    int method;
    int versionMajor;
    int versionMinor;
    bool complete;
    std::uint32_t contentLength;
    std::string rawPath;
    std::string body;
    std::vector<std::string> texts;

    bool operator==(const Outcome&) const = default;
};

bool IsWithin(std::string_view text, std::string_view part) {
    return text.find(part) != std::string_view::npos;
}

void CheckOutcome(const Outcome& outcome, const oxRequest& request, std::string_view text) {
    Check(outcome.good == (outcome.status == oxRequest::STATUS_GOOD));
    Check(outcome.status == oxRequest::STATUS_GOOD || outcome.status == oxRequest::STATUS_TOO_LARGE ||
          outcome.status == oxRequest::STATUS_BAD);
    Check(!outcome.good || (outcome.method != oxRequest::METHOD_NONE && request.GetPath().starts_with('/')));
    Check(request.GetPath().find('\0') == std::string::npos);
    Check(request.GetPath().size() < oxRequestLimits::PATH_BUFFER);
    Check(request.GetPath().ends_with(request.GetExtension()));
    Check(outcome.rawPath.empty() || outcome.rawPath.starts_with('/'));
    Check(IsWithin(text, outcome.rawPath));
    Check(outcome.body.size() == outcome.contentLength);
    Check(IsWithin(text, outcome.body));
    Check(IsWithin(text, request.GetQueryString()));
    Check(IsWithin(text, request.GetUserAgent()));
    Check(IsWithin(text, request.GetIfModifiedSince()));
    Check(request.GetVersionText().empty() || request.GetVersionText().size() == 8);
    Check(request.GetUser().size() + request.GetPassword().size() <= oxCredentials::MAX_PAIR);
}

Outcome Run(const std::vector<std::string_view>& pieces, std::string_view text) {
    Connection connection(text.size() > INLINE_LIMIT ? Connection::STREAM : Connection::PIECES);
    LineLog log;
    const auto request = std::make_unique<oxRequest>();
    for (const std::string_view piece : pieces)
        Check(connection.PeerSend(piece));
    connection.PeerEnd();
    const bool good = request->Read(connection.Server(), log) && request->Parse();
    Check(log.Lines().empty());
    const Outcome outcome{
        good,
        request->GetStatus(),
        request->GetMethod(),
        request->GetVersionMajor(),
        request->GetVersionMinor(),
        request->IsComplete(),
        request->GetContentLength(),
        std::string(request->GetRawPath()),
        std::string(request->GetBody()),
        {request->GetPath(), request->GetExtension(), request->GetQueryString(), request->GetVersionText(),
         request->GetIfModifiedSince(), request->GetUserAgent(), request->GetUser(), request->GetPassword()}};
    CheckOutcome(outcome, *request, text);
    return outcome;
}

// Pieces of 1 to 256 bytes, as the two bytes say; the last one is what remains.
std::vector<std::string_view> Cut(std::string_view text, std::uint8_t sizes, std::uint8_t seed) {
    std::vector<std::string_view> pieces;
    std::uint32_t state = seed;
    while (!text.empty()) {
        state = state * 1664525 + 1013904223;
        const std::size_t size = pieces.size() + 1 == MAX_PIECES ? text.size() : 1 + (state >> 16) % (sizes + 1u);
        pieces.push_back(text.substr(0, size));
        text.remove_prefix(pieces.back().size());
    }
    return pieces;
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    if (size < CUT_BYTES)
        return 0;
    const std::string_view text =
        std::string_view(reinterpret_cast<const char*>(data), size).substr(CUT_BYTES, MAX_TEXT);
    const Outcome whole = Run({text}, text);
    // Beyond the inline buffer it matters how much comes at a time: more than the announced body is an error only
    // when it fills the large buffer.
    if (text.size() <= INLINE_LIMIT)
        Check(Run(Cut(text, data[0], data[1]), text) == whole);
    return 0;
}
