// Settings files: whatever the text, what it says is said by its rewritten text too.
#include <algorithm>
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <set>
#include <string>
#include <string_view>

#include "platform/config.h"

namespace {

constexpr std::size_t MAX_NAMES = 16;
const std::string MISSING = "\x01missing\x02";

void Check(bool holds) {
    if (!holds)
        std::abort();
}

std::string Trim(std::string_view text) {
    constexpr std::string_view blanks = " \t\v\f\r\n";
    const std::size_t from = text.find_first_not_of(blanks);
    if (from == std::string_view::npos)
        return {};
    return std::string(text.substr(from, text.find_last_not_of(blanks) - from + 1));
}

// All that may be a section or a key: more than there are do no harm.
struct Names {
    std::set<std::string> sections{"", "RemoteConfiguration"};
    std::set<std::string> keys{"", "WebPort"};
};

Names Collect(std::string_view text) {
    Names names;
    while (!text.empty()) {
        const std::size_t end = std::min(text.find_first_of("\r\n"), text.size());
        const std::string_view line = text.substr(0, end);
        text.remove_prefix(std::min(end + 1, text.size()));
        const std::size_t open = line.find('[');
        if (open != std::string_view::npos && names.sections.size() < MAX_NAMES)
            names.sections.insert(Trim(line.substr(open + 1, line.find(']', open) - open - 1)));
        if (line.find('=') != std::string_view::npos && names.keys.size() < MAX_NAMES)
            names.keys.insert(Trim(line.substr(0, line.find('='))));
    }
    return names;
}

void CheckSame(const oxConfig& one, const oxConfig& other, const Names& names) {
    for (const std::string& section : names.sections) {
        for (const std::string& key : names.keys) {
            const char* s = section.c_str();
            const char* k = key.c_str();
            Check(one.HasKey(s, k) == other.HasKey(s, k));
            Check(one.GetText(s, k, MISSING) == other.GetText(s, k, MISSING));
            Check(one.GetInt(s, k, -7) == other.GetInt(s, k, -7));
            Check(one.GetBool(s, k, true) == other.GetBool(s, k, true));
            Check(one.HasKey(s, k) || one.GetText(s, k, MISSING) == MISSING);
        }
    }
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    const std::string_view text(reinterpret_cast<const char*>(data), size);
    oxConfig config;
    const bool loaded = config.OpenText(text);
    Check(loaded == config.IsOpen());
    if (text.find('\0') != std::string_view::npos)
        Check(!loaded);
    if (!loaded)
        return 0;
    const Names names = Collect(text);
    oxConfig again;
    Check(again.OpenText(config.Text()));
    CheckSame(config, again, names);

    // A value that is put reads back, here and after a rewrite.
    const std::string value = Trim(text.substr(0, text.find_first_of("\r\n")));
    if (config.PutText("RemoteConfiguration", "WebPort", value)) {
        Check(config.GetText("RemoteConfiguration", "WebPort", MISSING) == value);
        Check(again.OpenText(config.Text()));
        CheckSame(config, again, names);
        Check(again.GetText("RemoteConfiguration", "WebPort", MISSING) == value);
    }
    return 0;
}
