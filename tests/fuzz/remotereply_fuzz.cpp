// The answer of the remote service.
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <memory>
#include <string>
#include <string_view>

#include "app/remotereply.h"

namespace {

void Check(bool holds) {
    if (!holds)
        std::abort();
}

struct Outcome {
    bool good = false;
    int status = 0;
    std::string text;
    bool operator==(const Outcome&) const = default;
};

Outcome Parse(std::string_view received) {
    const auto exact = std::make_unique<char[]>(received.size());
    received.copy(exact.get(), received.size());
    static oxRemoteReply reply;  // each run also finds out whether it forgets the one before
    if (!reply.Parse({exact.get(), received.size()}))
        return {};
    return {true, reply.Status(), std::string(reply.Text())};
}

// The same by cutting at the bars.
Outcome Expected(std::string_view received) {
    const std::string_view text = received.substr(0, received.find('\0'));
    const std::size_t first = text.find('|');
    const std::size_t second = first == std::string_view::npos ? first : text.find('|', first + 1);
    if (second == std::string_view::npos || first == 0 || first > 16 || text.size() > 65534 ||
        text.substr(second) != "|EOT")
        return {};
    const std::string status(text.substr(0, first));
    const long long number = std::strtoll(status.c_str(), nullptr, 10);
    const long long limited = number > INT32_MAX ? INT32_MAX : number < INT32_MIN ? INT32_MIN : number;
    return {true, static_cast<int>(limited), std::string(text.substr(first + 1, second - first - 1))};
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    const std::string_view received(reinterpret_cast<const char*>(data), size);
    Check(Parse(received) == Expected(received));
    // Short ones also as the end of a text about as long as is allowed.
    if (size <= 16) {
        const std::string padded = "0|" + std::string(65520, 'x') + std::string(received);
        Check(Parse(padded) == Expected(padded));
    }
    // What lies behind the end makes no difference.
    const std::string ended = std::string(received) + '\0';
    Check(Parse(ended) == Parse(ended + "|more|EOT"));
    return 0;
}
