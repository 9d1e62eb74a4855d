// The upload session over libcurl.
//
// One thread per session drives a libcurl multi handle; every completion is
// posted to the configuration's delegate queue, in the order transfers end.
// Bodies are streamed from their file, opened only when the transfer starts
// sending (without following links; only a regular file owned by this user
// is sent), so queued transfers hold no descriptor. Easy handles are reused.
// Over HTTP/2 the transfers to one host share one connection as streams. No cookies, no cache, no
// redirects; TLS peer and host verification are always on, the trust store
// is the configuration's CA file when given, and the public-key pin string
// restricts the accepted server keys when given. At most
// `maxConnectionsPerHost` connections are open to one host; further
// transfers wait for one.
//
// Lifetime: `finishTasksAndInvalidate` refuses new tasks, keeps the session
// alive until its running tasks have ended, then posts `onInvalidated` once
// to the delegate queue. Destroying the session without it abandons the
// running tasks; their completions are never called. `cancelAllTasks`
// abandons queued and running transfers at once, completing each with a
// `cancelled` error. The destructor joins the session's thread.
#pragma once

#include "platform/http_session.h"

#include <memory>
#include <string>

namespace fbf {

// Null, with an error logged, when libcurl cannot be loaded: it is loaded
// with the first session rather than at launch.
std::shared_ptr<HttpClientSession> makeCurlHttpSession(HttpSessionConfiguration config);

// The one mapping from a libcurl result code (with the OS error of the
// connection attempt, 0 if none) to the error the upload rules look at.
HttpError httpErrorFromCurl(int curlCode, long osErrno, const std::string& detail);

}  // namespace fbf
