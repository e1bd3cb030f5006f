// The part of oxReply that lets a page declare its own content type.
#include <algorithm>
#include <cstring>
#include <string>

#include "platform/text.h"
#include "protocol/reply.h"

namespace {

constexpr std::string_view HEAD_START = "<head>";
constexpr std::string_view HEAD_END = "</head>";
constexpr std::string_view META = "meta";
constexpr std::string_view HTTP_EQUIV = "http-equiv";
constexpr std::string_view CONTENT = "content";
constexpr std::string_view CONTENT_TYPE = "content-type";
constexpr std::string_view BLANKS = " \t";

// A place in the lower-cased head of a page. Steps forward only, never behind the end.
class Cursor {
public:
    explicit Cursor(std::string_view text) : m_text(text) {}

    std::size_t At() const { return m_at; }
    bool AtEnd() const { return m_at == m_text.size(); }
    std::string_view Rest() const { return m_text.substr(m_at); }
    void Advance(std::size_t count) { m_at += count; }
    void SkipBlanks() { m_at = std::min(m_text.find_first_not_of(BLANKS, m_at), m_text.size()); }
    void SkipTo(char c) { m_at = std::min(m_text.find(c, m_at), m_text.size()); }
    // Steps over the word if it stands here.
    bool Take(std::string_view word) {
        if (!Rest().starts_with(word))
            return false;
        Advance(word.size());
        return true;
    }
    // `="` with blanks around each; stops where it does not fit.
    bool TakeValueStart() {
        SkipBlanks();
        if (!Take("="))
            return false;
        SkipBlanks();
        if (!Take("\""))
            return false;
        SkipBlanks();
        return true;
    }

private:
    std::string_view m_text;
    std::size_t m_at = 0;
};

// Where a tag begins, in any case, from the given place on.
std::size_t FindTag(std::string_view page, std::string_view tag, std::size_t from) {
    for (std::size_t at = page.find('<', from); at != std::string_view::npos; at = page.find('<', at + 1))
        if (StartsWithNoCase(page.substr(at), tag))
            return at;
    return std::string_view::npos;
}

}  // namespace

void oxReply::ScanForMetaTags(const char* buffer, std::size_t length) {
    const std::string_view page(buffer, strnlen(buffer, std::min(length, META_SCAN_BYTES)));
    const std::size_t start = FindTag(page, HEAD_START, 0);
    if (start == std::string_view::npos)
        return;
    const std::size_t from = start + HEAD_START.size();
    const std::size_t end = FindTag(page, HEAD_END, from);
    if (end == std::string_view::npos)
        return;
    char head[META_SCAN_BYTES];
    std::transform(page.begin() + from, page.begin() + end, head, static_cast<char (*)(char)>(ToLower));
    Cursor cursor(std::string_view(head, end - from));
    for (cursor.SkipTo('<'); !cursor.AtEnd(); cursor.SkipTo('<')) {
        cursor.Advance(1);
        cursor.SkipBlanks();
        if (cursor.Take(META))
            cursor.Advance(ParseMetaTag(cursor.Rest()));
    }
}

// Takes what stands behind "meta"; the count of characters that are done with.
std::size_t oxReply::ParseMetaTag(std::string_view text) {
    Cursor cursor(text);
    cursor.SkipBlanks();
    if (!cursor.Take(HTTP_EQUIV)) {
        cursor.SkipTo('>');
        return cursor.At();
    }
    if (!cursor.TakeValueStart())
        return cursor.At();
    const std::string_view name = cursor.Rest();
    const std::size_t nameEnd = name.find('"');
    if (nameEnd == std::string_view::npos)
        return cursor.At();
    cursor.Advance(nameEnd + 1);
    cursor.SkipBlanks();
    if (!cursor.Take(CONTENT) || !cursor.TakeValueStart() || cursor.AtEnd())
        return cursor.At();
    ApplyMetaHeader(name, cursor.Rest());
    cursor.SkipTo('"');
    cursor.SkipTo('>');
    return cursor.At();
}

// Both texts run on behind their closing quotes; of the name only the beginning is compared.
void oxReply::ApplyMetaHeader(std::string_view name, std::string_view value) {
    const std::size_t end = value.find('"');
    if (!name.starts_with(CONTENT_TYPE) || end == std::string_view::npos)
        return;
    m_contentTypeOverride = value.substr(0, end);
    // A line break in it would let a page add headers of its own.
    std::replace_if(m_contentTypeOverride.begin(), m_contentTypeOverride.end(), IsControl, ' ');
}
