#include "resources/resource.h"

oxResource_Invalid::oxResource_Invalid(const oxHttpStatus& status, const char* extraHeaders)
    : m_status(status), m_extraHeaders(extraHeaders == nullptr ? "" : extraHeaders) {}

std::unique_ptr<oxReply> oxResource_Invalid::GetReply(const oxRequest&) {
    return std::make_unique<oxReply>(m_status, Http::TYPE_NONE, -1, 0, m_extraHeaders);
}
