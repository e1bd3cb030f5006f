// The directory of the user files.
#pragma once

#include <string>
#include <string_view>

#include "platform/file.h"

// Makes each change of a file whole: a text is written to a file beside it, whose name is not a user file's, flushed to
// disk and only then given the name. No thread rules of its own; the user base serialises.
class oxUserDirectory {
public:
    // While one exists, no other process or object has one for the same directory. False when it could not be had: the
    // directory is missing, or somebody held it for longer than PATIENCE.
    class Lock {
    public:
        explicit Lock(const oxUserDirectory& directory);
        ~Lock();
        Lock(const Lock&) = delete;
        Lock& operator=(const Lock&) = delete;
        explicit operator bool() const { return static_cast<bool>(m_directory); }

    private:
        UniqueFd m_directory;
    };
    static constexpr int PATIENCE_MILLISECONDS = 2000;
    // The longest name, without its ending, that is given to a new file.
    static constexpr std::size_t MAX_STEM = 200;

    explicit oxUserDirectory(std::string path = {}) : m_path(std::move(path)) {}
    const std::string& Path() const { return m_path; }
    std::string PathOf(const std::string& fileName) const;

    // Makes the directory, mode 0700, and those above it. True when it exists afterwards.
    bool Create() const;
    // Gives the file a new text; it is made when it is missing.
    bool Replace(const std::string& fileName, std::string_view text) const;
    // Makes a file for a new user under a name that nothing has, and says which.
    bool Add(const std::string& userName, std::string_view text, std::string& fileName) const;
    // True when the file is gone afterwards.
    bool Remove(const std::string& fileName) const;
    // Removes what changes left behind that a crash ended; only under the lock, where no change can be under way.
    void RemoveLeftovers(const Lock& lock) const;

    // The name of a user's file without its ending: "%XX" stands for each byte outside A-Z a-z 0-9 . _ - @ and for a
    // dot at the front. One that would be too long is cut, and ends in a number made of the whole name.
    static std::string StemOf(std::string_view userName);

private:
    // The path of the new file; empty when it could not be written.
    std::string WriteBeside(const std::string& fileName, std::string_view text) const;
    void Flush() const;

    std::string m_path;
};
