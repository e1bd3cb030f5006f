// The argument text of a script's command, taken apart.
#pragma once

#include <functional>
#include <map>
#include <string>
#include <string_view>

// "username=bob&password=x%26y": pairs are split before they are decoded, so that no value can smuggle in a key. A text
// whose only "=" are escaped ones was escaped as a whole, and is decoded before it is split. A key without "=" counts
// as absent. A known key that comes twice, or a value that does not fit its key (control characters in a name or URL,
// a number that is none), makes the whole text bad. A decoded NUL ends the value that it stands in.
class oxScriptArguments {
public:
    static constexpr const char* KEY_USERNAME = "username";
    static constexpr const char* KEY_PASSWORD = "password";
    static constexpr const char* KEY_PERMISSIONS = "permissions";
    static constexpr const char* KEY_MAXPROFILES = "maxprofiles";
    static constexpr const char* KEY_LOGFILEURL = "logfileurl";
    static constexpr const char* KEY_PROFILE_ID = "profile_id";
    static constexpr const char* KEY_DECODE = "decode";

    // `raw` as it came from the engine.
    explicit oxScriptArguments(std::string_view raw);

    bool IsGood() const { return m_good; }
    bool Has(const char* key) const;
    // The default when the key is absent.
    std::string GetText(const char* key, const std::string& defaultValue = "") const;
    // A whole decimal number, limited to 32 bits; leading blanks and a sign may stand before it. The default when the
    // key is absent or its value is no number.
    int GetInt(const char* key, int defaultValue = 0) const;

private:
    void Split(std::string_view text, bool escaped);
    void Take(std::string key, std::string value);

    std::map<std::string, std::string, std::less<>> m_values;  // of the known keys
    bool m_good = true;
};
