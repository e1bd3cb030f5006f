#include "app/remotereply.h"

#include <algorithm>
#include <cstdint>
#include <cstdlib>
#include <limits>

bool oxRemoteReply::Parse(std::string_view received) {
    enum { STATUS, TEXT, MARKER } state = STATUS;
    m_status.Clear();
    m_text.Clear();
    m_marker.Clear();
    const std::string_view text = received.substr(0, received.find('\0'));
    if (text.size() > MAX_REPLY)
        return false;
    for (const char c : text) {
        bool fits = true;
        if (state == MARKER)
            fits = m_marker.Add(c);
        else if (c == SEPARATOR)
            state = state == STATUS ? TEXT : MARKER;
        else
            fits = state == STATUS ? m_status.Add(c) : m_text.Add(c);
        if (!fits)
            return false;
    }
    return state == MARKER && m_marker.View() == END_MARKER && !m_status.View().empty();
}

int oxRemoteReply::Status() const {
    constexpr int DECIMAL = 10;
    char digits[MAX_STATUS + 1] = {};
    m_status.View().copy(digits, MAX_STATUS);
    const std::int64_t value = std::strtoll(digits, nullptr, DECIMAL);
    return static_cast<int>(
        std::clamp<std::int64_t>(value, std::numeric_limits<int>::min(), std::numeric_limits<int>::max()));
}
