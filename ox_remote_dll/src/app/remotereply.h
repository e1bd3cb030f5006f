// The answer of the remote service, taken apart.
#pragma once

#include <array>
#include <cstddef>
#include <string_view>

// "0|reply text|EOT": a status number, the text for the script, the end marker. The fields lie in the object, which
// belongs on the stack of the thread that asked; nothing is allocated.
class oxRemoteReply {
public:
    static constexpr std::size_t MAX_REPLY = 65534;  // what is looked at of a reply, in bytes
    static constexpr std::size_t MAX_STATUS = 16;
    static constexpr std::size_t MAX_TEXT = 65535;
    static constexpr std::size_t MAX_MARKER = 4;
    static constexpr char SEPARATOR = '|';
    static constexpr std::string_view END_MARKER = "EOT";

    // Takes the text up to its first zero. False when it is no reply; what the other members give is not defined then.
    bool Parse(std::string_view received);

    // Decimal, limited to 32 bits; 0 for a field that is no number.
    int Status() const;
    std::string_view Text() const { return m_text.View(); }

private:
    template <std::size_t LIMIT>
    class Field {
    public:
        void Clear() { m_length = 0; }
        // False when there is no room.
        bool Add(char c) {
            if (m_length == LIMIT)
                return false;
            m_characters[m_length++] = c;
            return true;
        }
        std::string_view View() const { return {m_characters.data(), m_length}; }

    private:
        std::array<char, LIMIT> m_characters;  // those that count are written first
        std::size_t m_length = 0;
    };

    Field<MAX_STATUS> m_status;
    Field<MAX_TEXT> m_text;
    Field<MAX_MARKER> m_marker;
};
