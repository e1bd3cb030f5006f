// The search for a page's own content type.
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <memory>
#include <string>
#include <string_view>

#include "platform/text.h"
#include "protocol/reply.h"

namespace {

void Check(bool holds) {
    if (!holds)
        std::abort();
}

std::string Scan(std::string_view page) {
    const auto exact = std::make_unique<char[]>(page.size());
    page.copy(exact.get(), page.size());
    oxReply reply(Http::OK_200, Http::TYPE_HTML, -1, 0, nullptr);
    reply.ScanForMetaTags(exact.get(), page.size());
    const std::string header = reply.ComposeHeader();
    const std::string type = reply.GetContentTypeOverride();
    // Always one header line, whatever the page says.
    Check(header.find("\r\nContent-Type: " + (type.empty() ? "text/html" : type) + "\r\nDate: ") != std::string::npos);
    return type;
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    const std::string_view page(reinterpret_cast<const char*>(data), size);
    const std::string type = Scan(page);
    Check(type.find('"') == std::string::npos);
    Check(type == ToLower(type));
    for (const char c : type)
        Check(!IsControl(c));
    // What lies behind the limit or a NUL, and the case of letters, make no difference.
    const std::string_view seen = page.substr(0, page.substr(0, oxReply::META_SCAN_BYTES).find('\0'));
    Check(Scan(seen.substr(0, oxReply::META_SCAN_BYTES)) == type);
    Check(Scan(ToLower(page)) == type);
    return 0;
}
