// Which user may see which report profile.
#pragma once

#include <cstddef>
#include <map>
#include <string>

#include "rwlock.h"

// The user lists of the profile files (`*.wlp`) of one directory. A profile's identifier is its file's name with the
// ending; where no profile has exactly the identifier asked for, the text + ".wlp" is tried.
//
// Thread rules: any thread may ask at any time; a load or refresh changes everything in one step, so readers see the
// old lists or the new ones. Files are read before the lock is taken.
//
// Errors: a profiles directory or file that cannot be read (other than being gone) keeps the old entries.
class oxxProfileMap {
public:
    static constexpr const char* m_sPROFILE_FILE_MASK = "*.wlp";
    static constexpr const char* m_sPROFILE_FILE_ENDING = ".wlp";
    static constexpr const char* m_sADMIN = "admin";  // every profile permits this user
    static constexpr const char* m_pszINI_SECTION_PROFILE_USERS = "Profile";
    static constexpr const char* m_pszINI_KEY_PROFILE_USERS = "Users";
    static constexpr const char* m_pszKEY_PROFILE_ID = "profile_id";
    static constexpr std::size_t LIST_ROOM = 101;  // the profile list stops when fewer bytes than this are left

    oxxProfileMap();
    virtual ~oxxProfileMap();

    // Remembers the directory and reads every profile file in it.
    void Load(const std::string& directory);
    // Reads one profile file again. A name that cannot be a profile's ("/", a leading dot, another ending) does
    // nothing.
    void Refresh(const std::string& profile);
    bool IsPermitted(const std::string& user, const std::string& profile) const;
    // "profile_id=a.wlp&profile_id=b.wlp", as long as LIST_ROOM bytes are left.
    void ListProfiles(const std::string& user, char* buffer, std::size_t size) const;

private:
    using Entries = std::multimap<std::string, std::string>;  // user -> profile
    std::string m_directory;
    Entries m_entries;
    mutable RWLock m_lock;
};
