// A file under a document root.
#pragma once

#include <string>
#include <string_view>

#include "resources/resource.h"

// Answers with the file root + URL path, joined as they stand: the URL resolution has checked the path. A path that
// ends in "/" names the default file of that directory. Whatever cannot be opened is answered with 404.
class oxResource_StaticFile : public oxResource {
public:
    static constexpr std::string_view m_sDEFAULT_FILE = "default.htm";

    // With the flag the answer never is 304.
    oxResource_StaticFile(std::string root, bool ignoreIfModifiedSince);
    std::unique_ptr<oxReply> GetReply(const oxRequest& request) override;

private:
    const std::string m_root;
    const bool m_ignoreIfModifiedSince;
};
