#include "app/profilemap.h"

#include <cerrno>
#include <mutex>
#include <utility>

#include "platform/config.h"
#include "platform/directory.h"
#include "platform/file.h"
#include "platform/filename.h"
#include "users/keyvaluemap.h"

namespace {

constexpr const char* BLANKS_AND_COMMAS = " ,";

bool IsProfileName(const std::string& name) {
    return name.ends_with(oxxProfileMap::m_sPROFILE_FILE_ENDING) && !name.starts_with('.') &&
           name.find('/') == std::string::npos && name.find('\0') == std::string::npos;
}

}  // namespace

oxxProfileMap::oxxProfileMap() : m_entries(std::make_shared<const Entries>()) {}

oxxProfileMap::~oxxProfileMap() = default;

void oxxProfileMap::Load(const std::string& directory) {
    const std::scoped_lock lock(m_changing);
    const bool another = m_directory != directory;
    if (another)
        m_profiles.clear();  // published with the new ones, in one step
    m_directory = directory;
    oxDirIterator files(directory, m_sPROFILE_FILE_MASK);
    if (!files.IsValid()) {
        if (another)
            Publish();
        return;
    }
    Profiles profiles;
    while (const std::string* name = files.Next()) {
        Users users;
        const Outcome outcome = ReadProfile(directory, *name, users);
        if (outcome == Outcome::Read)
            profiles[*name] = std::move(users);
        else if (const auto old = m_profiles.find(*name); outcome == Outcome::Unreadable && old != m_profiles.end())
            profiles[*name] = old->second;
    }
    m_profiles.swap(profiles);
    Publish();
}

void oxxProfileMap::Refresh(const std::string& profile) {
    const std::scoped_lock lock(m_changing);
    if (m_directory.empty())
        return;  // nothing was ever loaded
    if (!RefreshExactly(profile))
        RefreshExactly(profile + m_sPROFILE_FILE_ENDING);
}

// False when there is no such profile, neither before nor now.
bool oxxProfileMap::RefreshExactly(const std::string& profile) {
    if (!IsProfileName(profile))
        return false;
    Users users;
    switch (ReadProfile(m_directory, profile, users)) {
        case Outcome::Read:
            m_profiles[profile] = std::move(users);
            break;
        case Outcome::Gone:
            if (m_profiles.erase(profile) == 0)
                return false;
            break;
        case Outcome::Unreadable:
            return true;
    }
    Publish();
    return true;
}

oxxProfileMap::Outcome oxxProfileMap::ReadProfile(const std::string& directory, const std::string& profile,
                                                  Users& users) {
    std::string text;
    if (!ReadWholeFile(oxFilename::Join(directory, profile), text))
        return errno == ENOENT ? Outcome::Gone : Outcome::Unreadable;
    return ReadUsers(text, users) ? Outcome::Read : Outcome::Unreadable;
}

bool oxxProfileMap::ReadUsers(std::string_view fileText, Users& users) {
    users.clear();
    oxConfig file;
    if (!file.OpenText(fileText))
        return false;
    const std::string list = file.GetText(m_pszINI_SECTION_PROFILE_USERS, m_pszINI_KEY_PROFILE_USERS, "");
    for (auto name = list.find_first_not_of(BLANKS_AND_COMMAS); name != std::string::npos;) {
        const auto comma = list.find(',', name);
        users.push_back(list.substr(name, comma - name));  // blanks inside and behind belong to the name
        name = list.find_first_not_of(BLANKS_AND_COMMAS, comma);
    }
    users.emplace_back(m_sADMIN);
    return true;
}

void oxxProfileMap::Publish() {
    auto entries = std::make_shared<Entries>();
    for (const auto& [profile, users] : m_profiles) {
        for (const std::string& user : users)
            entries->emplace(user, profile);
    }
    std::shared_ptr<const Entries> old = std::move(entries);
    const std::scoped_lock lock(m_snapshotLock);
    m_entries.swap(old);
}

std::shared_ptr<const oxxProfileMap::Entries> oxxProfileMap::Snapshot() const {
    const std::scoped_lock lock(m_snapshotLock);
    return m_entries;
}

bool oxxProfileMap::Holds(const Entries& entries, const std::string& user, const std::string& profile) {
    const auto [begin, end] = entries.equal_range(user);
    for (auto entry = begin; entry != end; ++entry) {
        if (entry->second == profile)
            return true;
    }
    return false;
}

bool oxxProfileMap::IsPermitted(const std::string& user, const std::string& profile) const {
    const auto entries = Snapshot();
    if (Holds(*entries, user, profile))
        return true;
    // That user has every profile there is.
    return !Holds(*entries, m_sADMIN, profile) && Holds(*entries, user, profile + m_sPROFILE_FILE_ENDING);
}

void oxxProfileMap::ListProfiles(const std::string& user, char* buffer, std::size_t size) const {
    if (size == 0)
        return;
    buffer[0] = '\0';
    const auto entries = Snapshot();
    const auto [begin, end] = entries->equal_range(user);
    std::size_t left = size;
    for (auto entry = begin; entry != end && left >= LIST_ROOM; ++entry) {
        const int written = KeyValueMap::Append(buffer, size, m_pszKEY_PROFILE_ID, entry->second.c_str());
        if (written == 0)
            return;
        left -= static_cast<std::size_t>(written);
    }
}
