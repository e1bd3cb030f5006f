// Arguments of a script's command: no value smuggles in a key, whatever bytes it is made of.
#include <algorithm>
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <iterator>
#include <string>
#include <string_view>

#include "app/scriptarguments.h"
#include "app/urltext.h"

namespace {

constexpr const char* KEYS[] = {oxScriptArguments::KEY_USERNAME,    oxScriptArguments::KEY_PASSWORD,
                                oxScriptArguments::KEY_PERMISSIONS, oxScriptArguments::KEY_MAXPROFILES,
                                oxScriptArguments::KEY_LOGFILEURL,  oxScriptArguments::KEY_PROFILE_ID,
                                oxScriptArguments::KEY_DECODE};

void Require(bool holds) {
    if (!holds)
        std::abort();
}

std::string Escape(std::string_view text) {
    constexpr char DIGITS[] = "0123456789ABCDEF";
    std::string escaped;
    for (const char c : text) {
        const auto byte = static_cast<unsigned char>(c);
        escaped.append({'%', DIGITS[byte >> 4], DIGITS[byte & 0xf]});
    }
    return escaped;
}

std::string UpToNul(std::string_view text) {
    return std::string(text.substr(0, text.find('\0')));
}

bool HasControls(std::string_view text) {
    return std::any_of(text.begin(), text.end(), [](unsigned char byte) { return byte < ' ' || byte == 0x7f; });
}

std::size_t KnownKeys(const oxScriptArguments& arguments) {
    return static_cast<std::size_t>(
        std::count_if(std::begin(KEYS), std::end(KEYS), [&](const char* key) { return arguments.Has(key); }));
}

// Any text: what is known of it came from a pair of its own.
void CheckAnyText(std::string_view text) {
    const oxScriptArguments arguments(text);
    const std::string pairs = text.find('=') != std::string_view::npos ? std::string(text) : DecodeUrlBytes(text);
    const auto separators = static_cast<std::size_t>(std::count(pairs.begin(), pairs.end(), '&'));
    Require(KnownKeys(arguments) <= separators + 1);
    for (const char* key : KEYS) {
        const std::string value = arguments.GetText(key, "absent");
        Require(arguments.Has(key) || value == "absent");
        Require(value.size() <= std::max<std::size_t>(text.size(), 6) && value.find('\0') == std::string::npos);
        arguments.GetInt(key);
    }
    if (arguments.IsGood()) {
        Require(!HasControls(arguments.GetText(oxScriptArguments::KEY_USERNAME)));
        Require(!HasControls(arguments.GetText(oxScriptArguments::KEY_LOGFILEURL)));
    }
    Require(DecodeUrlText(text) == UpToNul(DecodeUrlBytes(text)));
    std::string buffer = UpToNul(text);
    const std::string before = buffer;
    DecodeUrlTextInPlace(buffer.data());
    Require(buffer.c_str() == DecodeUrlText(before));
}

// Escaped values come out as they were and bring nothing else with them.
void CheckEscapedValues(std::string_view name, std::string_view password) {
    const oxScriptArguments arguments("username=" + Escape(name) + "&password=" + Escape(password));
    Require(arguments.IsGood() == !HasControls(name));
    Require(KnownKeys(arguments) == 2);
    Require(arguments.GetText(oxScriptArguments::KEY_USERNAME) == UpToNul(name));
    Require(arguments.GetText(oxScriptArguments::KEY_PASSWORD) == UpToNul(password));

    const oxScriptArguments whole(Escape("password=" + Escape(password)));
    Require(whole.GetText(oxScriptArguments::KEY_PASSWORD) == Escape(password));
    Require(KnownKeys(whole) == 1);
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    // A copy of exactly the size, so that a sanitizer sees every read behind it.
    const std::string input(reinterpret_cast<const char*>(data), size);
    CheckAnyText(input);
    const std::string_view text = input;
    CheckEscapedValues(text.substr(0, size / 2), text.substr(size / 2));
    return 0;
}
