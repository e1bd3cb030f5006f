#include "protocol/request.h"

#include <sys/socket.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <new>

#include "protocol/http.h"

namespace {

constexpr std::string_view BLANK_LINE = "\r\n\r\n";
constexpr std::string_view LENGTH_NAME = Http::SZ_CONTENT_LENGTH;
constexpr std::string_view LENGTH_NAME2 = Http::SZ_CONTENT_LENGTH2;
constexpr std::int64_t LENGTH_SATURATED = std::int64_t{1} << 40;  // far above anything accepted

// The number at the start of a text; 0 when it starts with anything but a digit.
std::int64_t ParseLength(std::string_view text) {
    std::int64_t length = 0;
    for (const char c : text) {
        if (c < '0' || c > '9')
            break;
        length = std::min(length * 10 + (c - '0'), LENGTH_SATURATED);
    }
    return length;
}

}  // namespace

oxRequest::oxRequest() : m_buffer(m_inlineBuffer) {
    m_inlineBuffer[0] = '\0';
}

const char* oxRequest::GetMethodName() const {
    switch (m_method) {
        case METHOD_GET:
            return Http::SZ_METHOD_GET;
        case METHOD_HEAD:
            return Http::SZ_METHOD_HEAD;
        case METHOD_POST:
            return Http::SZ_METHOD_POST;
        case METHOD_NONE:
            break;
    }
    return "";
}

std::string_view oxRequest::GetRawPath() const {
    return m_rawUrl == NOWHERE ? std::string_view() : std::string_view(m_buffer + m_rawUrl, m_pathLength);
}

std::string_view oxRequest::GetBody() const {
    return m_body == NOWHERE ? std::string_view() : std::string_view(m_buffer + m_body, m_contentLength);
}

void oxRequest::Reset() {
    m_buffer = m_inlineBuffer;
    m_largeBuffer.reset();
    m_inlineBuffer[0] = '\0';
    m_limit = oxRequestLimits::INLINE_BUFFER - 1;
    m_count = 0;
    m_headerEnd = m_rawUrl = m_body = NOWHERE;
    m_announcedLength = -1;
    m_contentLength = 0;
    m_pathLength = 0;
    m_watchBody = m_complete = false;
    m_status = STATUS_GOOD;
    m_method = METHOD_NONE;
}

bool oxRequest::Read(oxSocket& socket, oxErrorSink& log) {
    Reset();
    for (;;) {
        if (socket.GetHandle() == -1)
            return FailTimedOut(log);
        const int arrived = socket.Recv(m_buffer + m_count, static_cast<int>(m_limit - m_count), MSG_DONTWAIT);
        int error = arrived < 0 ? socket.GetLastError() : 0;
        if (error == EAGAIN || error == EWOULDBLOCK)
            error = socket.WaitReadable() == Readiness::Failed ? socket.GetLastError() : EINTR;
        // What a receive brings after another thread closed the socket looks like the peer's end; it is not.
        if (socket.GetHandle() == -1)
            return FailTimedOut(log);
        if (error == EINTR || error == EAGAIN)
            continue;
        if (error != 0)
            return FailRead(error, log);
        if (arrived == 0) {
            m_complete = true;
            return true;
        }
        m_count += static_cast<std::size_t>(arrived);
        m_buffer[m_count] = '\0';
        const Step step = TakeArrived(socket, static_cast<std::size_t>(arrived));
        if (step != Step::More) {
            m_complete = step == Step::Done;
            return m_complete;
        }
    }
}

oxRequest::Step oxRequest::TakeArrived(oxSocket& socket, std::size_t arrived) {
    const bool full = m_count == m_limit;
    if (full && m_largeBuffer != nullptr) {
        Drain(socket);
        m_status = STATUS_BAD;
        return Step::Failed;
    }
    if (m_headerEnd == NOWHERE) {
        FindHeaderEnd(arrived);
        if (m_headerEnd == NOWHERE) {
            if (!full)
                return Step::More;
            m_status = STATUS_TOO_LARGE;
            return Step::Failed;
        }
        if (!FindAnnouncedLength()) {
            Cut();
            return Step::Done;
        }
        arrived = m_count - BodyStart();
    }
    if (m_watchBody && BodyNamesLength(arrived)) {
        Cut();
        return Step::Done;
    }
    if (m_announcedLength < 1)
        return Step::Done;
    // Only here is a length found to be too large: not before the inline buffer is full.
    if (full && !Grow()) {
        m_status = STATUS_TOO_LARGE;
        return Step::Failed;
    }
    if (static_cast<std::int64_t>(m_count - BodyStart()) < m_announcedLength)
        return Step::More;
    m_body = BodyStart();
    m_contentLength = static_cast<std::uint32_t>(m_announcedLength);
    return Step::Done;
}

// Looks at what has just arrived, and the three bytes before that may begin the blank line.
void oxRequest::FindHeaderEnd(std::size_t arrived) {
    const std::size_t before = m_count - arrived;
    const std::size_t from = before - std::min(before, BLANK_LINE.size() - 1);
    const void* found = memmem(m_buffer + from, m_count - from, BLANK_LINE.data(), BLANK_LINE.size());
    if (found != nullptr)
        m_headerEnd = static_cast<std::size_t>(static_cast<const char*>(found) - m_buffer);
}

// The first place in the header block that holds the name is taken for the header, whatever stands around it. False
// when there is none: then nothing behind the header block is read.
bool oxRequest::FindAnnouncedLength() {
    const std::string_view text = Text();
    std::size_t at = text.find(LENGTH_NAME);
    if (at == std::string_view::npos) {
        at = text.find(LENGTH_NAME2);
        if (at == std::string_view::npos)
            return false;
        // The first spelling goes before the second wherever it stands; but a NUL would end the text before the body.
        m_watchBody = text.size() == BodyStart();
    }
    std::string_view value = text.substr(at + LENGTH_NAME.size());
    if (!value.empty())
        value.remove_prefix(1);
    if (value.starts_with(' '))
        value.remove_prefix(1);
    m_announcedLength = ParseLength(value);
    return true;
}

// True when the first spelling of the length's name stands in the body behind a header with the second: the request
// then counts as one without a body. Like every text, the body ends at a NUL here.
bool oxRequest::BodyNamesLength(std::size_t arrived) {
    const std::size_t end = static_cast<std::size_t>(std::min<std::int64_t>(
        static_cast<std::int64_t>(m_count), static_cast<std::int64_t>(BodyStart()) + m_announcedLength));
    const std::size_t before = m_count - arrived;
    const std::size_t from = before - std::min(before - BodyStart(), LENGTH_NAME.size() - 1);
    if (from >= end)
        return false;
    const std::size_t length = strnlen(m_buffer + from, end - from);
    m_watchBody = length == end - from;
    return std::string_view(m_buffer + from, length).find(LENGTH_NAME) != std::string_view::npos;
}

// Exchanges the full inline buffer for one with room for the announced body.
bool oxRequest::Grow() {
    const std::int64_t size = m_announcedLength + static_cast<std::int64_t>(oxRequestLimits::INLINE_BUFFER);
    if (size > oxRequestLimits::MAX_GROWN)
        return false;
    m_largeBuffer.reset(new (std::nothrow) char[static_cast<std::size_t>(size)]);
    if (m_largeBuffer == nullptr)
        return false;
    std::memcpy(m_largeBuffer.get(), m_buffer, m_count + 1);
    m_buffer = m_largeBuffer.get();
    m_limit = static_cast<std::size_t>(size) - 1;
    return true;
}

// Takes what else has come, so that closing the connection does not reset it before the reply arrives.
void oxRequest::Drain(oxSocket& socket) {
    constexpr int block = static_cast<int>(oxRequestLimits::INLINE_BUFFER);
    for (int reads = 0; reads < oxRequestLimits::MAX_DRAIN_READS; ++reads)
        if (socket.Recv(m_inlineBuffer, block, MSG_DONTWAIT) != block)
            return;
}

void oxRequest::Cut() {
    m_count = BodyStart();
    m_buffer[m_count] = '\0';
}

std::size_t oxRequest::BodyStart() const {
    return m_headerEnd + BLANK_LINE.size();
}

bool oxRequest::FailTimedOut(oxErrorSink& log) {
    log.Error("Error reading request from socket - socket timed out.");
    return false;
}

bool oxRequest::FailRead(int error, oxErrorSink& log) {
    if (error == ECONNABORTED || error == ECONNRESET) {
        m_status = STATUS_ABORTED;
        return false;
    }
    log.Error("Error reading request from socket - socket error = %d", error);
    m_status = STATUS_SOCKET_ERROR;
    return false;
}
