#include "users/userfile.h"

#include <fcntl.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <ctime>

#include "platform/config.h"
#include "platform/file.h"
#include "users/oxuserbase.h"

namespace {

constexpr const char* SECTION = oxUserBase::m_pszINI_SECTION_USER_INFO;
constexpr const char* USERNAME = oxUserBase::m_pszINI_KEY_USERNAME;
constexpr const char* PASSWORD = oxUserBase::m_pszINI_KEY_PASSWORD;
constexpr const char* PLAINTEXT_PASSWORD = oxUserBase::m_pszINI_KEY_PLAINTEXT_PASSWORD;
constexpr const char* PERMISSIONS = oxUserBase::m_pszINI_KEY_PERMISSIONS;
constexpr const char* TEXT1 = oxUserBase::m_pszINI_KEY_LOGFILEURL;
constexpr const char* TEXT2 = oxUserBase::m_pszINI_KEY_MAXPROFILES;

// More than a tick of any file system's clock.
constexpr std::int64_t STAMP_SETTLES_NANOSECONDS = 100'000'000;

std::int64_t Nanoseconds(const timespec& time) {
    constexpr std::int64_t PER_SECOND = 1'000'000'000;
    return static_cast<std::int64_t>(time.tv_sec) * PER_SECOND + time.tv_nsec;
}

oxUserFile::State TakePassword(const oxConfig& config, oxUserFile::Content& content) {
    using enum oxUserFile::State;
    std::string& password = content.record.password;
    const std::string sealed = config.GetText(SECTION, PASSWORD, "");
    if (!sealed.empty()) {
        // A password that does not open must never become the empty one, which lets everybody in.
        if (oxDecrypt(sealed, password) && password.size() <= oxUserBase::MAX_PASSWORD)
            return User;
        WipeText(password);
        return Undecipherable;
    }
    content.isPlaintext = config.HasKey(SECTION, PLAINTEXT_PASSWORD);
    password = config.GetText(SECTION, PLAINTEXT_PASSWORD, "");
    if (password.size() <= oxUserBase::MAX_PLAINTEXT_PASSWORD)
        return User;
    WipeText(password);
    return PlaintextTooLong;
}

// An empty text has no key.
bool PutOrRemove(oxConfig& config, const char* key, const std::string& text) {
    if (!text.empty())
        return config.PutText(SECTION, key, text);
    config.Remove(SECTION, key);
    return true;
}

// Appends what the descriptor gives. 0 or an errno value.
int ReadText(int descriptor, std::string& text) {
    constexpr std::size_t BLOCK_BYTES = 4096;
    std::array<char, BLOCK_BYTES> block;
    while (true) {
        const ssize_t count = read(descriptor, block.data(), block.size());
        if (count == 0)
            return 0;
        if (count < 0 && errno == EINTR)
            continue;
        if (count < 0)
            return errno;
        text.append(block.data(), static_cast<std::size_t>(count));
        if (text.size() > oxUserFile::MAX_BYTES)
            return EFBIG;
    }
}

}  // namespace

oxFileStamp::oxFileStamp(const struct stat& status)
    : device(status.st_dev),
      inode(status.st_ino),
      size(status.st_size),
      modified(Nanoseconds(status.st_mtim)),
      changed(Nanoseconds(status.st_ctim)) {}

oxUserFile::Content oxUserFile::Parse(std::string_view text) {
    Content content;
    oxConfig config;
    if (!config.OpenText(text) || !config.HasSection(SECTION))
        return content;
    oxUserRecord& record = content.record;
    record.name = config.GetText(SECTION, USERNAME, "");
    // Nobody's password would be asked for: a request without a name must not find a user.
    if (record.name.empty())
        return content;
    content.state = TakePassword(config, content);
    record.permissions = static_cast<std::uint32_t>(config.GetInt(SECTION, PERMISSIONS, 0));
    record.text1 = config.GetText(SECTION, TEXT1, "").substr(0, oxUserBase::MAX_TEXT);
    record.text2 = config.GetText(SECTION, TEXT2, "").substr(0, oxUserBase::MAX_TEXT);
    return content;
}

bool oxUserFile::Compose(std::string_view before, const oxUserRecord& record, std::string& after) {
    oxConfig config;
    std::string sealed;
    if (!config.OpenText(before) || !oxEncrypt(record.password, sealed))
        return false;
    if (!config.PutText(SECTION, USERNAME, record.name) || !config.PutText(SECTION, PASSWORD, sealed) ||
        !config.PutInt(SECTION, PERMISSIONS, static_cast<int>(record.permissions)) ||
        !PutOrRemove(config, TEXT1, record.text1) || !PutOrRemove(config, TEXT2, record.text2))
        return false;
    config.Remove(SECTION, PLAINTEXT_PASSWORD);
    after = config.Text();
    return true;
}

int oxUserFile::Read(const std::string& path, std::string& text, oxFileStamp& stamp, bool& isStampCertain) {
    text.clear();
    const UniqueFd file = OpenFile(path, O_RDONLY | O_NONBLOCK);
    timespec now{};
    struct stat status {};
    if (!file || clock_gettime(CLOCK_REALTIME, &now) != 0 || fstat(file.Get(), &status) != 0)
        return errno;
    if (!S_ISREG(status.st_mode))
        return S_ISDIR(status.st_mode) ? EISDIR : EINVAL;
    stamp = oxFileStamp(status);
    isStampCertain = stamp.changed < Nanoseconds(now) - STAMP_SETTLES_NANOSECONDS;
    return ReadText(file.Get(), text);
}

int oxUserFile::ReadStamp(const std::string& path, oxFileStamp& stamp) {
    struct stat status {};
    if (stat(path.c_str(), &status) != 0)
        return errno;
    stamp = oxFileStamp(status);
    return 0;
}
