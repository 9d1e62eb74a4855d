#include "platform/curl_http_session.h"

#include "platform/file_manager.h"
#include "platform/logging.h"

#include <curl/curl.h>
#include <dlfcn.h>
#include <fcntl.h>
#include <strings.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <unordered_map>
#include <mutex>
#include <pthread.h>

#include <thread>
#include <type_traits>
#include <vector>

namespace fbf {
namespace {

// libcurl and the thirty or so libraries it pulls in are loaded the first
// time an upload session is made, not at exec: linked in, they double the
// time from launch to a listening socket, and many launches (socket
// activation for a status query, a timer that finds nothing to send) never
// upload. The names are the library's own, without the "curl_" prefix.
struct CurlApi {
  decltype(&::curl_global_init) global_init;
  decltype(&::curl_easy_init) easy_init;
  decltype(&::curl_easy_cleanup) easy_cleanup;
  decltype(&::curl_easy_reset) easy_reset;
  decltype(&::curl_easy_setopt) easy_setopt;
  decltype(&::curl_easy_getinfo) easy_getinfo;
  decltype(&::curl_easy_strerror) easy_strerror;
  decltype(&::curl_slist_append) slist_append;
  decltype(&::curl_slist_free_all) slist_free_all;
  decltype(&::curl_multi_init) multi_init;
  decltype(&::curl_multi_cleanup) multi_cleanup;
  decltype(&::curl_multi_setopt) multi_setopt;
  decltype(&::curl_multi_add_handle) multi_add_handle;
  decltype(&::curl_multi_remove_handle) multi_remove_handle;
  decltype(&::curl_multi_perform) multi_perform;
  decltype(&::curl_multi_poll) multi_poll;
  decltype(&::curl_multi_wakeup) multi_wakeup;
  decltype(&::curl_multi_info_read) multi_info_read;
};

// Null, with the reason in `why`, when libcurl cannot be loaded.
const CurlApi* loadCurl(std::string* why = nullptr) {
  static std::string failure;
  static const CurlApi* api = [] () -> const CurlApi* {
    // The soname of the libcurl the headers came from.
    void* handle = dlopen("libcurl.so.4", RTLD_NOW | RTLD_LOCAL);
    if (handle == nullptr) {
      const char* error = dlerror();
      failure = error != nullptr ? error : "dlopen failed";
      return nullptr;
    }
    static CurlApi loaded;
    bool complete = true;
    auto bind = [&](auto& slot, const char* name) {
      slot = reinterpret_cast<std::remove_reference_t<decltype(slot)>>(dlsym(handle, name));
      if (slot == nullptr && complete) {
        complete = false;
        failure = std::string("libcurl lacks ") + name;
      }
    };
    bind(loaded.global_init, "curl_global_init");
    bind(loaded.easy_init, "curl_easy_init");
    bind(loaded.easy_cleanup, "curl_easy_cleanup");
    bind(loaded.easy_reset, "curl_easy_reset");
    bind(loaded.easy_setopt, "curl_easy_setopt");
    bind(loaded.easy_getinfo, "curl_easy_getinfo");
    bind(loaded.easy_strerror, "curl_easy_strerror");
    bind(loaded.slist_append, "curl_slist_append");
    bind(loaded.slist_free_all, "curl_slist_free_all");
    bind(loaded.multi_init, "curl_multi_init");
    bind(loaded.multi_cleanup, "curl_multi_cleanup");
    bind(loaded.multi_setopt, "curl_multi_setopt");
    bind(loaded.multi_add_handle, "curl_multi_add_handle");
    bind(loaded.multi_remove_handle, "curl_multi_remove_handle");
    bind(loaded.multi_perform, "curl_multi_perform");
    bind(loaded.multi_poll, "curl_multi_poll");
    bind(loaded.multi_wakeup, "curl_multi_wakeup");
    bind(loaded.multi_info_read, "curl_multi_info_read");
    if (!complete) return nullptr;
    loaded.global_init(CURL_GLOBAL_DEFAULT);
    return &loaded;
  }();
  if (api == nullptr && why != nullptr) *why = failure;
  return api;
}

}  // namespace

HttpError httpErrorFromCurl(int curlCode, long osErrno, const std::string& detail) {
  HttpError e;
  auto code = static_cast<CURLcode>(curlCode);
  switch (code) {
    case CURLE_COULDNT_RESOLVE_HOST:
      e = {HttpErrorDomain::url, HttpErrorCode::cannotFindHost, {}};
      break;
    case CURLE_COULDNT_RESOLVE_PROXY:
      e = {HttpErrorDomain::url, HttpErrorCode::dnsLookupFailed, {}};
      break;
    case CURLE_COULDNT_CONNECT:
      e = {HttpErrorDomain::url,
           osErrno == ENETUNREACH ? HttpErrorCode::notConnectedToInternet : HttpErrorCode::cannotConnectToHost,
           {}};
      break;
    case CURLE_OPERATION_TIMEDOUT:
      e = {HttpErrorDomain::url, HttpErrorCode::timedOut, {}};
      break;
    case CURLE_SSL_CONNECT_ERROR:
    case CURLE_PEER_FAILED_VERIFICATION:
    case CURLE_SSL_PINNEDPUBKEYNOTMATCH:
    case CURLE_SSL_CACERT_BADFILE:
    case CURLE_SSL_CERTPROBLEM:
    case CURLE_SSL_CIPHER:
    case CURLE_SSL_ISSUER_ERROR:
    case CURLE_SSL_CRL_BADFILE:
    case CURLE_SSL_INVALIDCERTSTATUS:
      e = {HttpErrorDomain::url, HttpErrorCode::secureConnectionFailed, {}};
      break;
    case CURLE_READ_ERROR:
    case CURLE_ABORTED_BY_CALLBACK:
      e = {HttpErrorDomain::url, HttpErrorCode::fileUnreadable, {}};
      break;
    case CURLE_SEND_ERROR:
    case CURLE_RECV_ERROR:
    case CURLE_GOT_NOTHING:
    case CURLE_PARTIAL_FILE:
    case CURLE_SEND_FAIL_REWIND:
      // The connection was lost mid-exchange.
      e = {HttpErrorDomain::network, HttpErrorCode::other, {}};
      break;
    case CURLE_URL_MALFORMAT:
    case CURLE_UNSUPPORTED_PROTOCOL:
      e = {HttpErrorDomain::url, HttpErrorCode::other, {}};
      break;
    default:
      e = {HttpErrorDomain::other, HttpErrorCode::other, {}};
      break;
  }
  const CurlApi* curl = loadCurl();
  e.description = curl != nullptr ? curl->easy_strerror(code) : "libcurl error " + std::to_string(curlCode);
  if (!detail.empty()) e.description += ": " + detail;
  return e;
}

namespace {

spdlog::logger& log() { return logging::get("HttpSession"); }

struct Transfer {
  CURL* easy = nullptr;
  curl_slist* headers = nullptr;
  HttpRequest request;
  std::filesystem::path bodyPath;
  // Opened when the transfer first reads its body, so that transfers waiting
  // for a connection hold no descriptor.
  FileDescriptor body;
  int64_t bodySize = 0;
  HttpCompletion completion;
  HttpResponse response;
  bool readFailed = false;
  std::string readError;
  char errorBuffer[CURL_ERROR_SIZE] = {};

  ~Transfer() {
    // Only sessions make transfers, and a session exists only once libcurl is loaded.
    if (easy) loadCurl()->easy_cleanup(easy);
    if (headers) loadCurl()->slist_free_all(headers);
  }
};

// Opens the body without following links; only our own regular files.
FileDescriptor openBody(const std::filesystem::path& path, std::string& why) {
  FileDescriptor fd(::open(path.c_str(), O_RDONLY | O_NOFOLLOW | O_CLOEXEC));
  if (!fd.valid()) {
    why = std::string("cannot open the upload file: ") + strerror(errno);
    return {};
  }
  struct stat st {};
  if (fstat(fd.get(), &st) != 0 || !S_ISREG(st.st_mode) || st.st_uid != geteuid()) {
    why = "the upload file is not a regular file owned by this user";
    return {};
  }
  return fd;
}

bool ensureBodyOpen(Transfer& t) {
  if (t.body.valid()) return true;
  t.body = openBody(t.bodyPath, t.readError);
  if (!t.body.valid()) t.readFailed = true;
  return t.body.valid();
}

size_t readBody(char* buffer, size_t size, size_t nitems, void* userdata) {
  auto* t = static_cast<Transfer*>(userdata);
  if (!ensureBodyOpen(*t)) return CURL_READFUNC_ABORT;
  while (true) {
    ssize_t n = ::read(t->body.get(), buffer, size * nitems);
    if (n >= 0) return static_cast<size_t>(n);
    if (errno == EINTR) continue;
    t->readFailed = true;
    t->readError = strerror(errno);
    return CURL_READFUNC_ABORT;
  }
}

int seekBody(void* userdata, curl_off_t offset, int origin) {
  auto* t = static_cast<Transfer*>(userdata);
  if (!ensureBodyOpen(*t)) return CURL_SEEKFUNC_FAIL;
  return ::lseek(t->body.get(), static_cast<off_t>(offset), origin) < 0 ? CURL_SEEKFUNC_FAIL : CURL_SEEKFUNC_OK;
}

size_t discardBody(char*, size_t size, size_t nmemb, void*) { return size * nmemb; }

size_t collectHeader(char* buffer, size_t size, size_t nitems, void* userdata) {
  auto* t = static_cast<Transfer*>(userdata);
  std::string_view line(buffer, size * nitems);
  while (!line.empty() && (line.back() == '\n' || line.back() == '\r')) line.remove_suffix(1);
  if (line.starts_with("HTTP/")) {
    t->response.headers.clear();  // an interim (1xx) response ends here
  } else if (auto colon = line.find(':'); colon != std::string_view::npos) {
    auto value = line.substr(colon + 1);
    while (!value.empty() && value.front() == ' ') value.remove_prefix(1);
    t->response.headers.emplace_back(std::string(line.substr(0, colon)), std::string(value));
  }
  return size * nitems;
}

class CurlHttpSession final : public HttpClientSession, public std::enable_shared_from_this<CurlHttpSession> {
 public:
  // Finished easy handles kept for reuse (they keep their TLS session cache
  // and buffers); more than this are freed.
  static constexpr size_t kSpareHandles = 32;

  CurlHttpSession(const CurlApi& curl, HttpSessionConfiguration config) : curl_(curl), config_(std::move(config)) {
    if (!config_.delegateQueue) throw std::invalid_argument("an HTTP session needs a delegate queue");
    multi_ = curl_.multi_init();
    curl_.multi_setopt(multi_, CURLMOPT_MAX_HOST_CONNECTIONS, static_cast<long>(std::max(1, config_.maxConnectionsPerHost)));
    curl_.multi_setopt(multi_, CURLMOPT_PIPELINING, static_cast<long>(CURLPIPE_MULTIPLEX));
    thread_ = std::thread([this] {
      pthread_setname_np(pthread_self(), "http");
      run();
    });
  }

  ~CurlHttpSession() override {
    {
      std::lock_guard lock(mutex_);
      stop_ = true;
    }
    curl_.multi_wakeup(multi_);
    if (thread_.joinable()) {
      if (thread_.get_id() == std::this_thread::get_id()) {
        thread_.detach();
      } else {
        thread_.join();
      }
    }
    for (auto& [easy, t] : active_) curl_.multi_remove_handle(multi_, easy);
    active_.clear();
    spare_.clear();
    curl_.multi_cleanup(multi_);
  }

  void uploadFile(HttpRequest request, std::filesystem::path body, HttpCompletion completion) override {
    {
      std::lock_guard lock(mutex_);
      if (invalidating_ || cancelling_) {
        fail(std::move(completion), {HttpErrorDomain::url, HttpErrorCode::cancelled, "the session is invalidated"});
        return;
      }
    }
    // The size is known up front (the body goes out with a Content-Length);
    // the file itself is opened only when the transfer starts sending.
    struct stat st {};
    if (::lstat(body.c_str(), &st) != 0 || !S_ISREG(st.st_mode) || st.st_uid != geteuid()) {
      fail(std::move(completion), {HttpErrorDomain::url, HttpErrorCode::fileUnreadable,
                                   "the upload file is not a regular file owned by this user"});
      return;
    }
    auto t = std::make_unique<Transfer>();
    t->bodyPath = std::move(body);
    t->bodySize = st.st_size;
    t->request = std::move(request);
    t->completion = std::move(completion);
    {
      std::lock_guard lock(mutex_);
      incoming_.push_back(std::move(t));
    }
    curl_.multi_wakeup(multi_);
  }

  void finishTasksAndInvalidate() override {
    {
      std::lock_guard lock(mutex_);
      if (invalidating_) return;
      invalidating_ = true;
      keepAlive_ = shared_from_this();
    }
    curl_.multi_wakeup(multi_);
  }

  void cancelAllTasks() override {
    {
      std::lock_guard lock(mutex_);
      cancelling_ = true;
    }
    curl_.multi_wakeup(multi_);
  }

 private:
  void fail(HttpCompletion completion, HttpError error) {
    config_.delegateQueue->async([completion = std::move(completion), error = std::move(error)] {
      if (completion) completion(std::nullopt, error);
    });
  }

  // The session's thread only.
  CURL* takeHandle() {
    if (spare_.empty()) return curl_.easy_init();
    CURL* e = spare_.back().release();
    spare_.pop_back();
    curl_.easy_reset(e);
    return e;
  }

  void recycle(Transfer& t) {
    if (!t.easy) return;
    if (spare_.size() < kSpareHandles) spare_.emplace_back(t.easy);
    else curl_.easy_cleanup(t.easy);
    t.easy = nullptr;
  }

  bool configure(Transfer& t) {
    t.easy = takeHandle();
    if (!t.easy) return false;
    CURL* e = t.easy;
    curl_.easy_setopt(e, CURLOPT_URL, t.request.url.c_str());
    curl_.easy_setopt(e, CURLOPT_PROTOCOLS_STR, "http,https");
    curl_.easy_setopt(e, CURLOPT_NOSIGNAL, 1L);
    curl_.easy_setopt(e, CURLOPT_PRIVATE, &t);
    curl_.easy_setopt(e, CURLOPT_ERRORBUFFER, t.errorBuffer);
    curl_.easy_setopt(e, CURLOPT_FOLLOWLOCATION, 0L);
    // HTTP/2 where the server offers it (as streams of one connection);
    // transfers wait for that connection rather than opening more.
    curl_.easy_setopt(e, CURLOPT_HTTP_VERSION, static_cast<long>(CURL_HTTP_VERSION_2TLS));
    curl_.easy_setopt(e, CURLOPT_PIPEWAIT, 1L);

    curl_.easy_setopt(e, CURLOPT_READFUNCTION, readBody);
    curl_.easy_setopt(e, CURLOPT_READDATA, &t);
    curl_.easy_setopt(e, CURLOPT_SEEKFUNCTION, seekBody);
    curl_.easy_setopt(e, CURLOPT_SEEKDATA, &t);
    if (t.request.method == "PUT") {
      curl_.easy_setopt(e, CURLOPT_UPLOAD, 1L);
      curl_.easy_setopt(e, CURLOPT_INFILESIZE_LARGE, static_cast<curl_off_t>(t.bodySize));
    } else {
      curl_.easy_setopt(e, CURLOPT_POST, 1L);
      curl_.easy_setopt(e, CURLOPT_POSTFIELDSIZE_LARGE, static_cast<curl_off_t>(t.bodySize));
      if (t.request.method != "POST") curl_.easy_setopt(e, CURLOPT_CUSTOMREQUEST, t.request.method.c_str());
    }
    curl_.easy_setopt(e, CURLOPT_WRITEFUNCTION, discardBody);
    curl_.easy_setopt(e, CURLOPT_HEADERFUNCTION, collectHeader);
    curl_.easy_setopt(e, CURLOPT_HEADERDATA, &t);

    bool hasContentType = false;
    for (const auto& [name, value] : t.request.headers) {
      if (strcasecmp(name.c_str(), "Content-Type") == 0) hasContentType = true;
      t.headers = curl_.slist_append(t.headers, (name + ": " + value).c_str());
    }
    // The body is sent at once, and a request without a Content-Type must go
    // without one (libcurl would otherwise add a form type to every POST).
    t.headers = curl_.slist_append(t.headers, "Expect:");
    if (!hasContentType) t.headers = curl_.slist_append(t.headers, "Content-Type:");
    curl_.easy_setopt(e, CURLOPT_HTTPHEADER, t.headers);

    curl_.easy_setopt(e, CURLOPT_SSL_VERIFYPEER, 1L);
    curl_.easy_setopt(e, CURLOPT_SSL_VERIFYHOST, 2L);
    if (config_.pinnedPublicKeys) curl_.easy_setopt(e, CURLOPT_PINNEDPUBLICKEY, config_.pinnedPublicKeys->c_str());
    if (config_.caFile) {
      curl_.easy_setopt(e, CURLOPT_CAINFO, config_.caFile->c_str());
      curl_.easy_setopt(e, CURLOPT_CAPATH, nullptr);
    }
    // The time-out is an idle time-out: no progress for that long.
    long timeout = static_cast<long>(std::max<int64_t>(1, t.request.timeout.count()));
    curl_.easy_setopt(e, CURLOPT_CONNECTTIMEOUT, timeout);
    curl_.easy_setopt(e, CURLOPT_LOW_SPEED_LIMIT, 1L);
    curl_.easy_setopt(e, CURLOPT_LOW_SPEED_TIME, timeout);
    return true;
  }

  void run() {
    while (true) {
      std::vector<std::unique_ptr<Transfer>> incoming;
      bool cancel = false;
      {
        std::lock_guard lock(mutex_);
        if (stop_) return;
        incoming.swap(incoming_);
        cancel = cancelling_;
      }
      for (auto& t : incoming) {
        if (cancel) {
          fail(std::move(t->completion), {HttpErrorDomain::url, HttpErrorCode::cancelled, "the upload was cancelled"});
          continue;
        }
        if (!configure(*t)) {
          fail(std::move(t->completion), {HttpErrorDomain::other, HttpErrorCode::other, "cannot set up the transfer"});
          continue;
        }
        CURL* easy = t->easy;
        if (curl_.multi_add_handle(multi_, easy) != CURLM_OK) {
          fail(std::move(t->completion), {HttpErrorDomain::other, HttpErrorCode::other, "cannot start the transfer"});
          continue;
        }
        active_.emplace(easy, std::move(t));
      }
      if (cancel) cancelActive();
      int running = 0;
      curl_.multi_perform(multi_, &running);
      int queued = 0;
      while (CURLMsg* msg = curl_.multi_info_read(multi_, &queued)) {
        if (msg->msg == CURLMSG_DONE) finish(msg->easy_handle, msg->data.result);
      }
      maybeInvalidate();
      curl_.multi_poll(multi_, nullptr, 0, 1000, nullptr);
    }
  }

  // Abandons every running transfer; their files stay with their owners.
  void cancelActive() {
    for (auto& [easy, t] : active_) {
      curl_.multi_remove_handle(multi_, easy);
      fail(std::move(t->completion), {HttpErrorDomain::url, HttpErrorCode::cancelled, "the upload was cancelled"});
      recycle(*t);
    }
    active_.clear();
  }

  void finish(CURL* easy, CURLcode result) {
    auto node = active_.extract(easy);
    if (node.empty()) return;
    std::unique_ptr<Transfer> t = std::move(node.mapped());
    curl_.multi_remove_handle(multi_, easy);
    std::optional<HttpResponse> response;
    std::optional<HttpError> error;
    if (result == CURLE_OK) {
      long status = 0;
      curl_.easy_getinfo(easy, CURLINFO_RESPONSE_CODE, &status);
      t->response.statusCode = status;
      if (t->request.onStatus) t->request.onStatus(status);
      response = std::move(t->response);
    } else {
      long osErrno = 0;
      curl_.easy_getinfo(easy, CURLINFO_OS_ERRNO, &osErrno);
      std::string detail = t->readFailed ? t->readError : std::string(t->errorBuffer);
      error = httpErrorFromCurl(t->readFailed ? CURLE_READ_ERROR : result, osErrno, detail);
      log().debug("Transfer to {} failed: {}", t->request.url, error->description);
    }
    t->body.reset();
    recycle(*t);
    config_.delegateQueue->async([completion = std::move(t->completion), response = std::move(response),
                                  error = std::move(error)]() mutable {
      if (completion) completion(std::move(response), std::move(error));
    });
  }

  void maybeInvalidate() {
    std::shared_ptr<CurlHttpSession> self;
    {
      std::lock_guard lock(mutex_);
      if (!invalidating_ || invalidated_ || !incoming_.empty() || !active_.empty()) return;
      invalidated_ = true;
      self = std::move(keepAlive_);
    }
    // The last reference may go with this task, so the session is destroyed
    // on the delegate queue and never on its own thread.
    config_.delegateQueue->async([self = std::move(self), onInvalidated = config_.onInvalidated] {
      if (onInvalidated) onInvalidated();
    });
  }

  struct EasyCleanup {
    void operator()(CURL* e) const { loadCurl()->easy_cleanup(e); }
  };

  const CurlApi& curl_;
  HttpSessionConfiguration config_;
  CURLM* multi_ = nullptr;
  std::thread thread_;
  std::mutex mutex_;
  std::vector<std::unique_ptr<Transfer>> incoming_;  // guarded by mutex_
  bool stop_ = false;                                // guarded by mutex_
  bool invalidating_ = false;                        // guarded by mutex_
  bool invalidated_ = false;                         // guarded by mutex_
  bool cancelling_ = false;                          // guarded by mutex_
  std::shared_ptr<CurlHttpSession> keepAlive_;       // guarded by mutex_
  std::unordered_map<CURL*, std::unique_ptr<Transfer>> active_;  // the session's thread only
  std::vector<std::unique_ptr<CURL, EasyCleanup>> spare_;        // the session's thread only
};

}  // namespace

std::shared_ptr<HttpClientSession> makeCurlHttpSession(HttpSessionConfiguration config) {
  std::string why;
  const CurlApi* curl = loadCurl(&why);
  if (curl == nullptr) {
    log().error("Cannot load libcurl, so nothing can be uploaded: {}", why);
    return nullptr;
  }
  return std::make_shared<CurlHttpSession>(*curl, std::move(config));
}

}  // namespace fbf
