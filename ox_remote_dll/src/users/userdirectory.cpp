#include "users/userdirectory.h"

#include <fcntl.h>
#include <sys/file.h>
#include <unistd.h>

#include <cerrno>
#include <chrono>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <thread>

#include "platform/directory.h"
#include "platform/filename.h"
#include "platform/text.h"

namespace {

constexpr std::string_view ENDING = ".usr";
// Begins with a dot and ends in six letters: never one of "*.usr".
constexpr std::string_view BESIDE_ENDING = ".usr.tmp-XXXXXX";
constexpr const char* BESIDE_MASK = ".*.usr.tmp-??????";

bool IsPlain(char c) {
    return (c >= 'A' && c <= 'Z') || (c >= 'a' && c <= 'z') || (c >= '0' && c <= '9') || c == '.' || c == '_' ||
           c == '-' || c == '@';
}

// FNV-1a, which keeps long names that begin alike apart; a new file never takes a name that is taken anyway.
std::string NumberOf(std::string_view name) {
    constexpr std::uint64_t BASIS = 14695981039346656037u;
    constexpr std::uint64_t PRIME = 1099511628211u;
    std::uint64_t number = BASIS;
    for (const char c : name)
        number = (number ^ static_cast<unsigned char>(c)) * PRIME;
    char text[17];
    std::snprintf(text, sizeof text, "%016llx", static_cast<unsigned long long>(number));
    return text;
}

}  // namespace

oxUserDirectory::Lock::Lock(const oxUserDirectory& directory) {
    using namespace std::chrono;
    constexpr milliseconds PAUSE(5);
    m_directory = OpenFile(directory.Path(), O_RDONLY | O_DIRECTORY);
    const auto end = steady_clock::now() + milliseconds(PATIENCE_MILLISECONDS);
    while (m_directory && flock(m_directory.Get(), LOCK_EX | LOCK_NB) != 0) {
        if (errno == EINTR)
            continue;
        if (errno == EWOULDBLOCK && steady_clock::now() < end)
            std::this_thread::sleep_for(PAUSE);
        else
            m_directory.Reset();
    }
}

oxUserDirectory::Lock::~Lock() {
    // Not left to the closing: a child that is being started may hold the descriptor a little longer.
    if (m_directory)
        flock(m_directory.Get(), LOCK_UN);
}

std::string oxUserDirectory::PathOf(const std::string& fileName) const {
    return oxFilename::Join(m_path, fileName);
}

bool oxUserDirectory::Create() const {
    return !m_path.empty() && CreateDir(m_path, PRIVATE_DIRECTORY_MODE);
}

bool oxUserDirectory::Replace(const std::string& fileName, std::string_view text) const {
    const std::string beside = WriteBeside(fileName, text);
    if (beside.empty())
        return false;
    if (rename(beside.c_str(), PathOf(fileName).c_str()) != 0) {
        unlink(beside.c_str());
        return false;
    }
    Flush();
    return true;
}

bool oxUserDirectory::Add(const std::string& userName, std::string_view text, std::string& fileName) const {
    const std::string stem = StemOf(userName);
    fileName = stem + std::string(ENDING);
    const std::string beside = WriteBeside(fileName, text);
    if (beside.empty())
        return false;
    // A link, not a renaming: it takes no name that something has.
    bool made = false;
    for (int number = 1; !(made = link(beside.c_str(), PathOf(fileName).c_str()) == 0) && errno == EEXIST; ++number)
        fileName = stem + "-" + IntToText(number) + std::string(ENDING);
    unlink(beside.c_str());
    if (made)
        Flush();
    return made;
}

bool oxUserDirectory::Remove(const std::string& fileName) const {
    if (unlink(PathOf(fileName).c_str()) != 0 && errno != ENOENT)
        return false;
    Flush();
    return true;
}

void oxUserDirectory::RemoveLeftovers(const Lock& lock) const {
    if (!lock)
        return;
    oxDirIterator leftovers(m_path, BESIDE_MASK);
    while (const std::string* name = leftovers.Next())
        unlink(PathOf(*name).c_str());
}

std::string oxUserDirectory::StemOf(std::string_view userName) {
    constexpr char DIGITS[] = "0123456789ABCDEF";
    std::string stem;
    for (const char c : userName) {
        if (IsPlain(c) && !(c == '.' && stem.empty())) {
            stem += c;
        } else {
            const auto byte = static_cast<unsigned char>(c);
            stem.append(1, '%').append(1, DIGITS[byte >> 4]).append(1, DIGITS[byte & 15]);
        }
    }
    if (stem.size() <= MAX_STEM)
        return stem;
    const std::string number = NumberOf(userName);
    return stem.substr(0, MAX_STEM - 1 - number.size()) + "-" + number;
}

std::string oxUserDirectory::WriteBeside(const std::string& fileName, std::string_view text) const {
    const std::string stem = fileName.substr(0, fileName.size() - ENDING.size()).substr(0, MAX_STEM);
    std::string path = PathOf("." + stem + std::string(BESIDE_ENDING));
    const UniqueFd file(mkostemp(path.data(), O_CLOEXEC));  // mode 0600
    if (!file)
        return {};
    if (WriteAll(file.Get(), text.data(), text.size()) && fsync(file.Get()) == 0)
        return path;
    unlink(path.c_str());
    return {};
}

void oxUserDirectory::Flush() const {
    // The names have changed by now, so a failure here is no reason to say that nothing happened.
    if (const UniqueFd directory = OpenFile(m_path, O_RDONLY | O_DIRECTORY))
        fsync(directory.Get());
}
