// The settings file of one user.
#pragma once

#include <sys/stat.h>
#include <sys/types.h>

#include <cstdint>
#include <string>
#include <string_view>

#include "platform/encrypt.h"

struct oxUserRecord {
    std::string name;
    std::string password;  // in clear, wiped at the end; empty accepts any
    std::string text1;     // the log file URL
    std::string text2;     // the most profiles, in decimal
    std::uint32_t permissions = 0;

    oxUserRecord() = default;
    oxUserRecord(const oxUserRecord&) = default;
    oxUserRecord& operator=(const oxUserRecord&) = default;
    ~oxUserRecord() { WipeText(password); }
    bool operator==(const oxUserRecord&) const = default;
};

// Tells whether a file is still the one that was read, without reading it.
struct oxFileStamp {
    dev_t device = 0;
    ino_t inode = 0;
    off_t size = 0;
    std::int64_t modified = 0;  // nanoseconds since the epoch
    std::int64_t changed = 0;

    oxFileStamp() = default;
    explicit oxFileStamp(const struct stat& status);
    bool operator==(const oxFileStamp&) const = default;
};

namespace oxUserFile {

// More than this is not a user's file.
inline constexpr std::size_t MAX_BYTES = 1048576;

enum class State {
    User,
    NoUser,            // damaged, without the section or without a name
    PlaintextTooLong,  // the name is known, but the user cannot be used
    Undecipherable,    // the same
};

struct Content {
    State state = State::NoUser;
    oxUserRecord record;
    bool isPlaintext = false;  // the password came from the key for files that are written by hand

    bool operator==(const Content&) const = default;
};

// What a file's text says.
Content Parse(std::string_view text);
// The text with the record's values in their keys and no plaintext password; everything else in it is kept. False when
// the password cannot be enciphered, or the text or a value does not fit a settings file.
bool Compose(std::string_view before, const oxUserRecord& record, std::string& after);

// Reads a regular file of at most MAX_BYTES. 0 or an errno value: EISDIR or EINVAL for what is no regular file, EFBIG
// for one that is too large. The stamp is that of the text, and certain unless the file has changed a moment before:
// two changes within one tick of the file system's clock look like one.
int Read(const std::string& path, std::string& text, oxFileStamp& stamp, bool& isStampCertain);
// 0 or an errno value.
int ReadStamp(const std::string& path, oxFileStamp& stamp);

}  // namespace oxUserFile
