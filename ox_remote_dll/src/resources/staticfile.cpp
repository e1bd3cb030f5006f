#include "resources/staticfile.h"

#include <fcntl.h>
#include <sys/stat.h>

#include <utility>

#include "platform/file.h"
#include "platform/filename.h"
#include "protocol/httptime.h"

namespace {

// A reply without a file.
std::unique_ptr<oxReply> Bare(const oxHttpStatus& status, const oxHttpContentType& type) {
    return std::make_unique<oxReply>(status, type, -1, 0, nullptr);
}

}  // namespace

oxResource_StaticFile::oxResource_StaticFile(std::string root, bool ignoreIfModifiedSince)
    : m_root(std::move(root)), m_ignoreIfModifiedSince(ignoreIfModifiedSince) {}

std::unique_ptr<oxReply> oxResource_StaticFile::GetReply(const oxRequest& request) {
    std::string path = m_root + request.GetPath();
    if (path.ends_with('/'))
        path.append(m_sDEFAULT_FILE);
    const oxHttpContentType& type = Http::TypeFromExtension(oxFilename(path).Extension());

    struct stat file;
    if (!m_ignoreIfModifiedSince && !request.GetIfModifiedSince().empty()) {
        if (::stat(path.c_str(), &file) != 0)
            return Bare(Http::NOT_FOUND_404, Http::TYPE_NONE);
        if (oxHttpTime(request.GetIfModifiedSince()).Value() >= file.st_mtime)
            return Bare(Http::NOT_MODIFIED_304, type);
    }
    // Without blocking: opening a FIFO must not hold the session until somebody writes to it.
    UniqueFd handle = OpenFile(path, O_RDONLY | O_NONBLOCK);
    if (!handle)
        return Bare(Http::NOT_FOUND_404, Http::TYPE_NONE);
    std::string extraHeaders;
    std::uint32_t contentSize = 0;
    if (::fstat(handle.Get(), &file) == 0) {
        extraHeaders = Http::S_LAST_MODIFIED;
        oxHttpTime(file.st_mtime).Format(extraHeaders);
        extraHeaders.append(oxReply::m_CRLF);
        contentSize = static_cast<std::uint32_t>(file.st_size);
    }
    auto reply = std::make_unique<oxReply>(Http::OK_200, type, handle.Get(), contentSize, extraHeaders);
    handle.Release();
    return reply;
}
