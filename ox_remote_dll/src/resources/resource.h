// What a request's URL resolves to.
#pragma once

#include <atomic>
#include <memory>
#include <string>

#include "protocol/http.h"
#include "protocol/reply.h"
#include "protocol/request.h"

// Made for one request by the server's URL resolution; the session asks it for its reply and destroys both.
class oxResource {
public:
    virtual ~oxResource() = default;
    virtual std::unique_ptr<oxReply> GetReply(const oxRequest& request) = 0;

    // The flag that another thread sets when the answer is no longer wanted. A resource that may wait long looks at it
    // and gives up. It must outlive the resource.
    void SetStopFlag(const std::atomic<bool>& stop) { m_stop = &stop; }

protected:
    bool IsStopped() const { return m_stop != nullptr && m_stop->load(); }
    const std::atomic<bool>* m_stop = nullptr;
};

// A fixed answer without a file. The status object must outlive the resource.
class oxResource_Invalid : public oxResource {
public:
    // Complete header lines, each ended by CR LF; null or empty for none.
    oxResource_Invalid(const oxHttpStatus& status, const char* extraHeaders);
    std::unique_ptr<oxReply> GetReply(const oxRequest& request) override;

private:
    const oxHttpStatus& m_status;
    std::string m_extraHeaders;
};
