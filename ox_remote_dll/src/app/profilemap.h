// Which user may see which report profile.
#pragma once

#include <cstddef>
#include <map>
#include <memory>
#include <string>
#include <string_view>
#include <vector>

#include "platform/mutex.h"

// The user lists of the profile files (`*.wlp`) of one directory. A profile's identifier is its file's name with the
// ending; where no profile has exactly the identifier asked for, the text + ".wlp" is tried.
//
// Thread rules: any thread may ask at any time; a load or refresh changes everything in one step, so readers see the
// old lists or the new ones, and never wait for a file.
//
// Errors: a directory that cannot be listed, and a file that cannot be read or holds a NUL byte, keep the old entries;
// a file that is gone takes its entries with it.
class oxxProfileMap {
public:
    static constexpr const char* m_sPROFILE_FILE_MASK = "*.wlp";
    static constexpr const char* m_sPROFILE_FILE_ENDING = ".wlp";
    static constexpr const char* m_sADMIN = "admin";  // every profile permits this user
    static constexpr const char* m_pszINI_SECTION_PROFILE_USERS = "Profile";
    static constexpr const char* m_pszINI_KEY_PROFILE_USERS = "Users";
    static constexpr const char* m_pszKEY_PROFILE_ID = "profile_id";
    static constexpr std::size_t LIST_ROOM = 101;  // the profile list stops when fewer bytes than this are left

    using Users = std::vector<std::string>;

    oxxProfileMap();
    virtual ~oxxProfileMap();

    // Remembers the directory and reads every profile file in it. The profiles of another directory go, whether the new
    // one can be read or not; an empty name is a directory without profiles.
    void Load(const std::string& directory);
    // Reads one profile file again. A name that cannot be a profile's ("/", a leading dot, another ending) does
    // nothing.
    void Refresh(const std::string& profile);
    bool IsPermitted(const std::string& user, const std::string& profile) const;
    // "profile_id=a.wlp&profile_id=b.wlp" in the order of the names, as long as LIST_ROOM bytes are left and the next
    // pair fits whole.
    void ListProfiles(const std::string& user, char* buffer, std::size_t size) const;

    // The users that a profile file's text names, in its order, and `m_sADMIN` last. False when it is no settings file.
    static bool ReadUsers(std::string_view fileText, Users& users);

private:
    using Profiles = std::map<std::string, Users>;
    using Entries = std::multimap<std::string, std::string>;  // user -> profile
    enum class Outcome { Read, Gone, Unreadable };

    static Outcome ReadProfile(const std::string& directory, const std::string& profile, Users& users);
    static bool Holds(const Entries& entries, const std::string& user, const std::string& profile);
    bool RefreshExactly(const std::string& profile);
    void Publish();
    std::shared_ptr<const Entries> Snapshot() const;

    MMutex m_changing;  // held through a whole load or refresh, over the two below
    std::string m_directory;
    Profiles m_profiles;
    mutable MMutex m_snapshotLock;  // guards the pointer, not what it points to
    std::shared_ptr<const Entries> m_entries;
};
