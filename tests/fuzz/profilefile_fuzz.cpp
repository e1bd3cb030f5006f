// Profile files: whatever the text, the users are clean names, and the last one is the administrator.
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <string>
#include <string_view>

#include "app/profilemap.h"
#include "platform/config.h"

namespace {

void Require(bool holds) {
    if (!holds)
        std::abort();
}

void CheckFile(std::string_view text) {
    oxxProfileMap::Users users{"left over"};
    const bool read = oxxProfileMap::ReadUsers(text, users);
    Require(read == (text.find('\0') == std::string_view::npos));
    if (!read) {
        Require(users.empty());
        return;
    }
    Require(!users.empty() && users.back() == oxxProfileMap::m_sADMIN);
    std::size_t length = 0;
    for (const std::string& user : users) {
        Require(!user.empty() && user.front() != ' ');
        Require(user.find_first_of(",\r\n") == std::string::npos);
        length += user.size();
    }
    Require(length <= text.size() + users.back().size());

    // Each name stands in the list, in order.
    oxConfig file;
    Require(file.OpenText(text));
    const std::string list =
        file.GetText(oxxProfileMap::m_pszINI_SECTION_PROFILE_USERS, oxxProfileMap::m_pszINI_KEY_PROFILE_USERS, "");
    std::size_t position = 0;
    for (std::size_t i = 0; i + 1 < users.size(); ++i) {
        position = list.find(users[i], position);
        Require(position != std::string::npos);
        position += users[i].size();
        Require(position == list.size() || list[position] == ',');
    }
}

// The text as a list of users.
void CheckList(std::string_view text) {
    const std::string_view line = text.substr(0, text.find_first_of(std::string_view("\r\n\0", 3)));
    CheckFile("[Profile]\nUsers=" + std::string(line) + "\n");
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    // A copy of exactly the size, so that a sanitizer sees every read behind it.
    const std::string input(reinterpret_cast<const char*>(data), size);
    CheckFile(input);
    CheckList(input);
    return 0;
}
