// The product's own users: one settings file for each.
#pragma once

#include <atomic>
#include <cstddef>
#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <string>

#include "platform/mutex.h"
#include "users/userbase.h"
#include "users/userdirectory.h"
#include "users/userfile.h"

// The files `*.usr` of one directory, loaded into memory. Every changing operation reloads the files first (those that
// did not change are not read again), changes one user and writes that user's file, so edits by hand and by other
// processes are kept. `Authenticate` does not reload: an edit by hand counts from the next change or start on.
//
// Files: mode 0600, in a directory of mode 0700; a change is written beside, flushed to disk and renamed, so a file is
// whole at any moment. Keys and sections that mean nothing here are kept. Of several files with one user name the first
// counts, in the order of the file names; deleting the user removes them all.
//
// Several processes may change users of one directory: a change waits while another process makes one.
//
// Errors: a change whose file cannot be written is refused and changes nothing in memory; a directory that cannot be
// listed keeps the users that were loaded; a user whose password cannot be deciphered is not taken, with a line on
// standard error, and its file is left alone.
class oxUserBase : public UserBase {
public:
    static constexpr const char* m_pszUSER_FILE_MASK = "*.usr";
    static constexpr const char* m_pszINI_SECTION_USER_INFO = "UserInfo";
    static constexpr const char* m_pszINI_KEY_USERNAME = "username";
    static constexpr const char* m_pszINI_KEY_PASSWORD = "password";
    static constexpr const char* m_pszINI_KEY_PLAINTEXT_PASSWORD = "PlaintextPassword";
    static constexpr const char* m_pszINI_KEY_PERMISSIONS = "permissions";
    static constexpr const char* m_pszINI_KEY_LOGFILEURL = "logfileurl";
    static constexpr const char* m_pszINI_KEY_USER_N = "User%u";  // for other readers of user files
    static constexpr const char* m_pszINI_KEY_MAXPROFILES = "maxprofiles";
    static constexpr const char* m_pszTOKEN_KEY_USERNAME = "u";
    static constexpr const char* m_pszTOKEN_KEY_PERMISSIONS = "p";
    static constexpr std::size_t MAX_NAME = 255;
    static constexpr std::size_t MAX_PASSWORD = 351;
    static constexpr std::size_t MAX_PLAINTEXT_PASSWORD = 40;
    static constexpr std::size_t MAX_TEXT = 4095;
    static constexpr std::size_t LIST_ROOM = 99;  // the user list stops when no more than this is left

    oxUserBase();
    explicit oxUserBase(const std::string& directory);
    ~oxUserBase() override;

    // Names a directory and loads it; with another one than before, the users of that one are gone in any case. The
    // answer of LoadAll.
    bool Open(const std::string& directory);

    bool Authenticate(const std::string& name, const std::string& password, std::uint32_t* permissions) override;
    bool AddUser(const std::string& name, const std::string& password, std::uint32_t permissions,
                 const std::string& maxProfiles, const std::string& logFileUrl) override;
    bool DeleteUser(const std::string& name) override;
    bool SetPermissions(const std::string& name, std::uint32_t permissions) override;
    bool SetPassword(const std::string& name, const std::string& password) override;
    bool SetText1(const std::string& name, const std::string& text) override;
    bool SetText2(const std::string& name, const std::string& text) override;
    bool GetPermissionsText(const std::string& name, char* buffer, std::size_t size) override;
    virtual bool AllowsAnonymousUser();  // asked by AddUser before it would treat "anonymous" specially; always true

    // False when the directory is missing or cannot be listed; the users stay as they were. Also removes what a crash
    // in the middle of a change left in the directory.
    bool LoadAll();
    // Writes the user's file as it is in memory.
    bool SaveUser(const std::string& name);
    // "u1=alice&p1=3&u2=bob&p2=1" in the order of the names, as long as more than LIST_ROOM bytes are left.
    void ListUsers(char* buffer, std::size_t size);
    // The stored permissions, without a password check.
    bool FindUser(const std::string& name, std::uint32_t* permissions);
    // Grows with every change of a user that this object saw; remembered logins of an older number are checked again.
    std::uint64_t Generation() const { return m_generation.load(); }

    // How often a user file was read and deciphered; files that did not change are not.
    std::uint64_t FilesRead() const { return m_filesRead.load(); }

private:
    // One user file, as last read or written.
    struct File {
        std::string name;
        oxUserFile::Content content;
        oxFileStamp stamp;
        bool readAgain = true;  // at the next reload, whatever the stamp says then
        int readError = 0;      // why it could not be read the last time; then the rest is from before, or empty

        bool IsUser() const { return content.state == oxUserFile::State::User; }
    };
    using FilePointer = std::shared_ptr<const File>;
    using Files = std::map<std::string, FilePointer>;  // by file name
    using Users = std::map<std::string, std::string>;  // from user name to the file that counts

    bool Load();  // wants m_changing to be held, as Report
    static void Report(const File& file);
    // Want both to be held.
    int Reload();  // 0 or an errno value
    FilePointer Look(const std::string& fileName, const FilePointer& known);
    static FilePointer Unread(const std::string& path, int error, const FilePointer& known, const File& empty);
    void EncipherPlaintexts();
    bool IsSame(const Users& users, const Files& files) const;
    FilePointer* Find(const std::string& name);
    bool HasFile(const std::string& name) const;
    bool Store(const File& file);

    bool Change(const std::string& name, const std::function<void(oxUserRecord&)>& change);

    oxUserDirectory m_directory;
    Files m_files;
    Users m_users;
    // Held through a whole change, its wait for other processes included; logins wait for the other one only.
    MMutex m_changing;
    MMutex m_mutex;                                 // over the two maps and every file operation
    [[maybe_unused]] std::int32_t m_reserved = -1;  // kept; nothing reads it
    std::atomic<std::uint64_t> m_generation{1};
    std::atomic<std::uint64_t> m_filesRead{0};
};
