#include "app/scriptarguments.h"

#include <algorithm>
#include <cstdint>
#include <iterator>
#include <limits>
#include <optional>
#include <utility>

#include "app/urltext.h"
#include "platform/text.h"

namespace {

constexpr std::string_view BLANKS = " \t\n\v\f\r";

enum class Kind { Text, Line, Number };

struct KnownKey {
    std::string_view name;
    Kind kind;
};

constexpr KnownKey KNOWN_KEYS[] = {
    {oxScriptArguments::KEY_USERNAME, Kind::Line},      {oxScriptArguments::KEY_PASSWORD, Kind::Text},
    {oxScriptArguments::KEY_PERMISSIONS, Kind::Number}, {oxScriptArguments::KEY_MAXPROFILES, Kind::Number},
    {oxScriptArguments::KEY_LOGFILEURL, Kind::Line},    {oxScriptArguments::KEY_PROFILE_ID, Kind::Text},
    {oxScriptArguments::KEY_DECODE, Kind::Text},
};

// As strtol reads it, but nothing may follow the number.
std::optional<int> ParseNumber(std::string_view text) {
    using Limits = std::numeric_limits<std::int32_t>;
    text.remove_prefix(std::min(text.size(), text.find_first_not_of(BLANKS)));
    const bool negative = text.starts_with('-');
    if (negative || text.starts_with('+'))
        text.remove_prefix(1);
    if (text.empty())
        return std::nullopt;
    std::int64_t value = 0;
    for (const char c : text) {
        if (c < '0' || c > '9')
            return std::nullopt;
        value = std::min(value * 10 + (c - '0'), -std::int64_t{Limits::min()});
    }
    return static_cast<int>(std::clamp<std::int64_t>(negative ? -value : value, Limits::min(), Limits::max()));
}

}  // namespace

oxScriptArguments::oxScriptArguments(std::string_view raw) {
    if (raw.find('=') != std::string_view::npos)
        Split(raw, true);
    else
        Split(DecodeUrlBytes(raw), false);
}

void oxScriptArguments::Split(std::string_view text, bool escaped) {
    while (!text.empty()) {
        const std::string_view pair = text.substr(0, text.find('&'));
        text.remove_prefix(std::min(text.size(), pair.size() + 1));
        const auto equals = pair.find('=');
        if (equals == std::string_view::npos)
            continue;
        const std::string_view key = pair.substr(0, equals);
        const std::string_view value = pair.substr(equals + 1);
        if (escaped)
            Take(DecodeUrlBytes(key), DecodeUrlBytes(value));
        else
            Take(std::string(key), std::string(value));
    }
}

void oxScriptArguments::Take(std::string key, std::string value) {
    const auto* known = std::find_if(std::begin(KNOWN_KEYS), std::end(KNOWN_KEYS),
                                     [&](const KnownKey& one) { return one.name == key; });
    if (known == std::end(KNOWN_KEYS))
        return;
    if (known->kind == Kind::Line && std::any_of(value.begin(), value.end(), IsControl))
        m_good = false;
    if (known->kind == Kind::Number && !ParseNumber(value))
        m_good = false;
    value.resize(std::min(value.size(), value.find('\0')));
    if (!m_values.try_emplace(std::move(key), std::move(value)).second)
        m_good = false;
}

bool oxScriptArguments::Has(const char* key) const {
    return m_values.contains(std::string_view(key));
}

std::string oxScriptArguments::GetText(const char* key, const std::string& defaultValue) const {
    const auto found = m_values.find(std::string_view(key));
    return found != m_values.end() ? found->second : defaultValue;
}

int oxScriptArguments::GetInt(const char* key, int defaultValue) const {
    const auto found = m_values.find(std::string_view(key));
    return found != m_values.end() ? ParseNumber(found->second).value_or(defaultValue) : defaultValue;
}
