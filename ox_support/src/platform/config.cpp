#include "platform/config.h"

// The header's code in full, and only for plain characters: nothing of the library is linked.
#define SI_IMPLEMENTATION
#define SI_NO_CONVERSION
#include <SimpleIni.h>

#include <cerrno>
#include <charconv>
#include <cstdint>
#include <limits>
#include <optional>
#include <utility>

#include "platform/file.h"
#include "platform/text.h"

namespace {

constexpr std::string_view BYTE_ORDER_MARK = "\xEF\xBB\xBF";
constexpr std::string_view LINE_ENDS = "\r\n";
constexpr std::string_view BLANKS = " \t\r\n";
constexpr std::string_view NUL("\0", 1);
constexpr std::string_view LINE_ENDS_AND_NUL("\r\n\0", 3);

std::string_view Trimmed(std::string_view text) {
    const auto first = text.find_first_not_of(BLANKS);
    if (first == std::string_view::npos)
        return {};
    return text.substr(first, text.find_last_not_of(BLANKS) - first + 1);
}

enum class Line { Blank, Comment, Entry, Junk };

Line Classify(std::string_view line) {
    line = Trimmed(line);
    if (line.empty())
        return Line::Blank;
    if (line.front() == ';' || line.front() == '#')
        return Line::Comment;
    if (line.front() == '[')
        return line.find(']') != std::string_view::npos ? Line::Entry : Line::Junk;
    const auto equals = line.find('=');
    return equals != std::string_view::npos && equals > 0 ? Line::Entry : Line::Junk;
}

// A text made ready for the parser, which loses comments that no entry follows and takes the lines after an
// unclosed section name for a part of it.
struct PreparedText {
    std::string entries;   // up to the last section or key; lines that are nothing are made comments
    std::string trailing;  // the comments after that
};

PreparedText Prepare(std::string_view text) {
    if (text.starts_with(BYTE_ORDER_MARK))
        text.remove_prefix(BYTE_ORDER_MARK.size());
    PreparedText prepared;
    while (!text.empty()) {
        const std::string_view line = text.substr(0, text.find_first_of(LINE_ENDS));
        text.remove_prefix(line.size());
        if (text.starts_with("\r\n"))
            text.remove_prefix(2);
        else if (!text.empty())
            text.remove_prefix(1);
        const Line kind = Classify(line);
        if (kind == Line::Junk)
            prepared.trailing += ';';
        // Blank lines count inside a comment block only.
        if (kind != Line::Blank || !prepared.trailing.empty())
            prepared.trailing.append(line).append(1, '\n');
        if (kind == Line::Entry)
            prepared.entries.append(std::exchange(prepared.trailing, std::string()));
    }
    return prepared;
}

// The value of a text that is a number and nothing else, limited to the range of an int.
std::optional<int> ParseInt(std::string_view text) {
    const bool negative = text.starts_with('-');
    if (negative || text.starts_with('+'))
        text.remove_prefix(1);
    const bool hexadecimal = text.starts_with("0x") || text.starts_with("0X");
    if (hexadecimal)
        text.remove_prefix(2);
    std::uint64_t magnitude = 0;
    const char* const end = text.data() + text.size();
    const auto result = std::from_chars(text.data(), end, magnitude, hexadecimal ? 16 : 10);
    if (result.ptr != end || result.ec == std::errc::invalid_argument)
        return std::nullopt;
    using Limits = std::numeric_limits<int>;
    if (result.ec == std::errc::result_out_of_range || magnitude > static_cast<std::uint64_t>(Limits::max()))
        return negative ? Limits::min() : Limits::max();
    const int value = static_cast<int>(magnitude);
    return negative ? -value : value;
}

bool IsSectionName(std::string_view name) {
    return !name.empty() && Trimmed(name) == name && name.find(']') == std::string_view::npos &&
           name.find_first_of(LINE_ENDS) == std::string_view::npos;
}

bool IsKeyName(std::string_view name) {
    return !name.empty() && Trimmed(name) == name && name.find_first_of(";#[") != 0 &&
           name.find('=') == std::string_view::npos && name.find_first_of(LINE_ENDS) == std::string_view::npos;
}

}  // namespace

struct oxConfig::Data {
    Data() { ini.SetSpaces(false); }

    // Null when there is none. The section without a name is the text before the first section.
    const char* Find(const char* section, const char* key) const {
        return *section != '\0' ? ini.GetValue(section, key, nullptr) : nullptr;
    }

    CSimpleIniA ini{true, false, false};  // UTF-8, the last of equal keys counts, values are one line
    std::string comments;                 // that the parser did not get
    bool commentsFirst = false;
    std::string path;
    std::string errorText;
    bool open = false;
};

oxConfig::oxConfig() = default;
oxConfig::~oxConfig() = default;
oxConfig::oxConfig(oxConfig&&) noexcept = default;
oxConfig& oxConfig::operator=(oxConfig&&) noexcept = default;

oxConfig::Data& oxConfig::Own() {
    if (!m_data)
        m_data = std::make_unique<Data>();
    return *m_data;
}

bool oxConfig::Open(const std::string& path) {
    std::string text;
    const int error = ReadWholeFile(path, text) ? 0 : errno;
    if (error == 0) {
        OpenText(text);
    } else {
        Close();
        Own().errorText = GetLastErrorText(error);
    }
    m_data->path = path;
    return m_data->open;
}

bool oxConfig::OpenText(std::string_view text) {
    Close();
    Data& data = Own();
    if (text.find(NUL) != std::string_view::npos) {
        data.errorText = "The file holds a NUL byte";
        return false;
    }
    PreparedText prepared = Prepare(text);
    if (data.ini.LoadData(prepared.entries) < 0) {
        data.ini.Reset();
        data.errorText = GetLastErrorText(ENOMEM);  // the parser refuses nothing else
        return false;
    }
    data.comments = std::move(prepared.trailing);
    data.commentsFirst = prepared.entries.empty();
    data.open = true;
    return true;
}

void oxConfig::Close() {
    m_data.reset();
}

bool oxConfig::IsOpen() const {
    return m_data && m_data->open;
}

const std::string& oxConfig::Path() const {
    static const std::string NONE;
    return m_data ? m_data->path : NONE;
}

const std::string& oxConfig::ErrorText() const {
    static const std::string NONE;
    return m_data ? m_data->errorText : NONE;
}

std::string oxConfig::GetText(const char* section, const char* key, const std::string& defaultValue) const {
    const char* value = m_data ? m_data->Find(section, key) : nullptr;
    return value != nullptr ? std::string(value) : defaultValue;
}

int oxConfig::GetInt(const char* section, const char* key, int defaultValue) const {
    const char* value = m_data ? m_data->Find(section, key) : nullptr;
    return value != nullptr ? ParseInt(value).value_or(defaultValue) : defaultValue;
}

bool oxConfig::GetBool(const char* section, const char* key, bool defaultValue) const {
    const char* value = m_data ? m_data->Find(section, key) : nullptr;
    if (value == nullptr)
        return defaultValue;
    if (const std::optional<int> number = ParseInt(value))
        return *number != 0;
    return EqualNoCase(value, "yes") || EqualNoCase(value, "true") || EqualNoCase(value, "on");
}

bool oxConfig::HasKey(const char* section, const char* key) const {
    return m_data && m_data->Find(section, key) != nullptr;
}

bool oxConfig::HasSection(const char* section) const {
    return m_data && *section != '\0' && m_data->ini.GetSection(section) != nullptr;
}

bool oxConfig::PutText(const char* section, const char* key, const std::string& value) {
    if (!IsSectionName(section) || !IsKeyName(key) || value.find_first_of(LINE_ENDS_AND_NUL) != std::string::npos)
        return false;
    return Own().ini.SetValue(section, key, std::string(Trimmed(value)).c_str()) >= 0;
}

bool oxConfig::PutInt(const char* section, const char* key, int value) {
    return PutText(section, key, IntToText(value));
}

void oxConfig::Remove(const char* section, const char* key) {
    if (m_data && *section != '\0')
        m_data->ini.Delete(section, key);
}

std::string oxConfig::Text() const {
    std::string text;
    if (!m_data)
        return text;
    m_data->ini.Save(text);
    const std::string& comments = m_data->comments;
    if (text.empty() || comments.empty())
        return text + comments;
    return m_data->commentsFirst ? comments + '\n' + text : text + '\n' + comments;
}
