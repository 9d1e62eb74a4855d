#include "upload/upload_manager.h"

#include "assembly/cache_paths.h"
#include "assembly/fbf_strings.h"
#include "assembly/feedback_types.h"
#include "flushing/session_payload.h"
#include "platform/logging.h"
#include "upload/compressed_output_stream.h"
#include "util/build_info.h"
#include "util/lock.h"

#include "corevireon.pb.h"

#include <strings.h>
#include <unistd.h>

#include <array>
#include <ostream>

namespace fbf {
namespace {

spdlog::logger& log() { return logging::get("UploadManager"); }

bool equalsIgnoringCase(std::string_view a, std::string_view b) {
  return a.size() == b.size() && strncasecmp(a.data(), b.data(), a.size()) == 0;
}

void setHeader(HttpRequest& request, std::string_view name, const std::string& value) {
  for (auto& [k, v] : request.headers) {
    if (k == name) {
      v = value;
      return;
    }
  }
  request.headers.emplace_back(std::string(name), value);
}

std::vector<std::string_view> splitDroppingEmpty(std::string_view s, char sep) {
  std::vector<std::string_view> out;
  while (true) {
    auto pos = s.find(sep);
    auto piece = s.substr(0, pos);
    if (!piece.empty()) out.push_back(piece);
    if (pos == std::string_view::npos) break;
    s = s.substr(pos + 1);
  }
  return out;
}

int32_t feedbackTypeCode(const std::string& typeString) {
  return knownFeedbackTypeFromName(typeString, true).value_or(kKnownFeedbackTypeUnknown);
}

// The platform's offline-class errors: the flush cannot get anywhere now.
bool isOfflineError(const HttpError& e) {
  switch (e.code) {
    case HttpErrorCode::notConnectedToInternet:
    case HttpErrorCode::dnsLookupFailed:
    case HttpErrorCode::cannotConnectToHost:
    case HttpErrorCode::cannotFindHost:
      return true;
    default:
      return false;
  }
}

}  // namespace

// What a finished task needs; shared with the completions so that they stay
// valid when the manager is gone before its session's last task.
struct UploadManager::Core {
  explicit Core(FBFAssemblyProtocol& a) : assembly(a) {}
  FBFAssemblyProtocol& assembly;
  UploadManagerDelegate* delegate = nullptr;
  // Enqueued tasks whose outcome has not arrived yet (work queue only).
  size_t inFlight = 0;

  void notifyDelegate(const fs::path& file, long status) const {
    if (delegate) delegate->uploadManagerDidUploadFile(file, status);
  }

  void taskDidComplete(const fs::path& fileURL, const std::string& typeString, std::optional<HttpResponse> response,
                       std::optional<HttpError> error, const UploadCompletion& completion) {
    if (inFlight > 0) --inFlight;
    long status = response ? response->statusCode : 0;
    if (error && (error->domain == HttpErrorDomain::url || error->domain == HttpErrorDomain::network)) {
      if (isOfflineError(*error)) {
        log().error("Device appears to be offline. Flush cancelled.");
        assembly.setCancelled(true);
      }
      log().error("{} upload failed: {}", typeString, error->description);
      notifyDelegate(fileURL, status);
      if (completion) completion(std::move(response), std::move(error));
      return;
    }
    if (!response) {
      notifyDelegate(fileURL, 0);
      if (completion) completion(std::move(response), std::move(error));
      return;
    }
    if (response->statusCode == 200) {
      log().debug("{} upload completed successfully", typeString);
      auto& fm = assembly.fileManager();
      if (auto event = FeedbackDeletionEvent::make(fileURL, feedbackTypeCode(typeString),
                                                   FeedbackDeletionReason::uploaded, assembly.currentDate(), fm)) {
        assembly.didDeleteFeedbackFile(*event);
      }
      std::error_code ec;
      if (!fm.removeItem(fileURL, ec)) log().error("Error deleting file after successful upload");
    } else {
      log().error("{} upload failed with non-200 response code", typeString);
    }
    notifyDelegate(fileURL, status);
    if (completion) completion(std::move(response), std::move(error));
  }
};

UploadManager::UploadManager(FBFAssemblyProtocol& assembly, UploadBuildPredicates predicates)
    : assembly_(assembly),
      predicates_(std::move(predicates)),
      uploadSession_(assembly.makeUploadSession()),
      bag_(assembly.cachedBag()),
      fileManager_(assembly.fileManager()),
      core_(std::make_shared<Core>(assembly)) {
  if (!predicates_.isSeedBuild) predicates_.isSeedBuild = [] { return vireon_isSeedBuild(); };
  if (!predicates_.isInternalBuild) predicates_.isInternalBuild = [] { return vireon_isInternalBuild(); };
}

UploadManager::~UploadManager() {
  core_->delegate = nullptr;
  if (uploadSession_) uploadSession_->finishTasksAndInvalidate();
}

void UploadManager::setDelegate(UploadManagerDelegate* delegate) { core_->delegate = delegate; }

UploadManagerFactory UploadManager::factory() {
  return [](FBFAssemblyProtocol& assembly) -> std::unique_ptr<UploadManagerProtocol> {
    return std::make_unique<UploadManager>(assembly);
  };
}

// ---- request formation ----

std::vector<QueryItem> UploadManager::debugQueryItems(std::string_view parameters) {
  std::vector<QueryItem> items;
  for (auto piece : splitDroppingEmpty(parameters, '&')) {
    auto parts = splitDroppingEmpty(piece, '=');
    if (parts.size() == 2) items.push_back({std::string(parts[0]), std::string(parts[1])});
  }
  return items;
}

HttpRequest UploadManager::feedbackUploadRequest(const std::string& url, const std::string& type) {
  // A malformed endpoint from the bag is bad input, not a broken build: it is
  // refused like a non-http(s) one instead of stopping the process.
  auto components = URLComponents::parse(url);
  if (!components) throw VireonURLRequestBuilder::URLError();
  VireonURLRequestBuilder builder(std::move(*components));

  builder.defaultQueryItemWithName("v", "2");
  if (!type.empty()) builder.defaultQueryItemWithName("type", type);
  if (predicates_.isSeedBuild()) builder.defaultQueryItemWithName("seed", "1");
  if (predicates_.isInternalBuild()) builder.defaultQueryItemWithName("internal", "1");
  if (auto debug = assembly_.userDefaults().stringForKey(FBFStrings::Defaults::DebugQueryParameters)) {
    for (auto& item : debugQueryItems(*debug)) builder.forceQueryItem(std::move(item));
  }
  if (assembly_.isFlushingEagerly()) builder.forceQueryItemWithName(std::string(FBFStrings::QueryItems::Realtime), "1");
  builder.defaultHttpHeader(std::string(FBFStrings::HTTPHeaders::UserAgent), assembly_.deviceContext().userAgent());
  builder.defaultHttpHeader(std::string(FBFStrings::HTTPHeaders::ContentEncoding), "deflate");
  builder.defaultQueryItemWithName(std::string(FBFStrings::QueryItems::Key), std::string(kClientKey));

  HttpRequest request = builder.createUrlRequest();
  request.ignoreLocalCache = true;
  request.timeout = kUploadTimeout;
  request.method = "POST";
  // Deliberately asymmetric: the protobuf session type must be spelled
  // exactly, the two protobuf custom types may come in any letter case.
  if (type == FBFStrings::VireonProtobufFeedbackType || equalsIgnoringCase(type, "UserReport") ||
      equalsIgnoringCase(type, "Usage")) {
    setHeader(request, FBFStrings::HTTPHeaders::ContentType, "application/protobuf");
  }
  return request;
}

std::optional<std::string> UploadManager::endpointForCustomType(const ConfigurationBag& bag, const std::string& type) {
  if (type == "Crowdsourcing") {
    if (auto url = bag.crowdsourcingURL()) return url;
  }
  return bag.feedbackURL();
}

// ---- upload files ----

std::optional<std::pair<FileDescriptor, fs::path>> UploadManager::makeFileForCompressedVireonFeedback(
    const SessionFilename& session) {
  auto dir = cacheDirNoCreate(fileManager_);
  if (!dir) return std::nullopt;
  fs::path path = *dir / session.uploadFilenameString();
  std::error_code ec;
  FileDescriptor fd = fileManager_.createForWriting(path, ec);
  if (!fd.valid()) return std::nullopt;
  return std::make_pair(std::move(fd), std::move(path));
}

std::optional<std::pair<FileDescriptor, fs::path>> UploadManager::makeFileForCompressedCustomFeedback(
    const fs::path& url) {
  fs::path path = url;
  path += std::string(FBFStrings::UploadPendingSuffix);
  std::error_code ec;
  FileDescriptor fd = fileManager_.createForWriting(path, ec);
  if (!fd.valid()) return std::nullopt;
  return std::make_pair(std::move(fd), std::move(path));
}

std::optional<fs::path> UploadManager::urlForFileHandle(int fd) {
  std::array<char, 4096> buf{};
  auto link = "/proc/self/fd/" + std::to_string(fd);
  ssize_t n = readlink(link.c_str(), buf.data(), buf.size() - 1);
  if (n <= 0 || buf[0] != '/') return std::nullopt;
  return fs::path(std::string(buf.data(), static_cast<size_t>(n)));
}

void UploadManager::removeQuietly(const fs::path& file) {
  std::error_code ec;
  fileManager_.removeItem(file, ec);
}

// ---- preparations ----

std::optional<UploadRequest> UploadManager::uploadProtobufFeedback(const corevireon::CVClientSession& session,
                                                                   const fs::path& sessionURL) {
  auto name = SessionFilename::fromString(sessionURL.filename().string());
  if (name) name->uploadFormat = UploadFormat::pb;
  auto file = name ? makeFileForCompressedVireonFeedback(*name) : std::nullopt;
  if (!file) {
    log().error("Error getting temp file.");
    return std::nullopt;
  }
  auto& [fd, fileURL] = *file;
  // Until the payload is compressed the upload file is an empty placeholder;
  // it is removed when the preparation fails before that.
  auto endpoint = bag_ ? bag_->feedbackURL() : std::nullopt;
  if (!endpoint) {
    log().error("feedback uploader found no upload endpoint from defaults.");
    removeQuietly(fileURL);
    return std::nullopt;
  }
  // Deterministic: the upload is byte for byte what `fbfctl explain` shows.
  const std::string bytes = serializeSessionDeterministically(session);
  auto fileStream = std::make_shared<FileOutputStream>(std::move(fd));
  CompressedOutputStream stream(fileStream);
  log().debug("Compressing feedback to {}", fileURL.string());
  stream.open();
  if (fileStream->streamStatus() == StreamStatus::error) {
    log().error("error opening output stream");
    removeQuietly(fileURL);
    return std::nullopt;
  }
  stream.write(reinterpret_cast<const uint8_t*>(bytes.data()), bytes.size());
  stream.close();

  if (assembly_.userDefaults().boolForKey(FBFStrings::Defaults::LeaveFeedbackAfterUpload)) {
    log().info("Respecting LeaveFeedbackAfterUpload and leaving compressed feedback file {}", fileURL.string());
    std::error_code ec;
    auto dir = cacheDirNoCreate(fileManager_);
    bool copied = false;
    if (dir) copied = fileManager_.copyItem(fileURL, *dir / (sessionURL.filename().string() + ".deflate"), ec);
    if (!copied) log().error("Error copying compressed upload data for LeaveFeedbackAfterUpload {}", fileURL.string());
  }

  HttpRequest request;
  try {
    request = feedbackUploadRequest(*endpoint, std::string(FBFStrings::VireonProtobufFeedbackType));
  } catch (const VireonURLRequestBuilder::URLError&) {
    log().error("feedbackUploadRequest failed because of bad url.");
    return std::nullopt;
  }
  setHeader(request, FBFStrings::HTTPHeaders::Digest, stream.dataDigestForStream());
  log().debug("Protobuf vireon feedback upload to {}", request.url.empty() ? "unknown?" : request.url);
  return UploadRequest{std::move(request), fileURL, stream.uncompressedBytesWritten(), stream.compressedBytesWritten(),
                       std::string(FBFStrings::VireonProtobufFeedbackType)};
}

std::optional<UploadRequest> UploadManager::uploadJSONFeedback(const nlohmann::ordered_json& dictionary,
                                                               const fs::path& sessionURL) {
  auto name = SessionFilename::fromString(sessionURL.filename().string());
  if (name) name->uploadFormat = UploadFormat::json;
  auto file = name ? makeFileForCompressedVireonFeedback(*name) : std::nullopt;
  if (!file) {
    log().error("Error getting temp file.");
    return std::nullopt;
  }
  auto& [fd, fileURL] = *file;
  auto endpoint = bag_ ? bag_->feedbackURL() : std::nullopt;
  if (!endpoint) {
    log().error("feedback uploader found no upload endpoint from defaults.");
    removeQuietly(fileURL);
    return std::nullopt;
  }
  auto fileStream = std::make_shared<FileOutputStream>(std::move(fd));
  CompressedOutputStream stream(fileStream);
  log().debug("Compressing feedback to {}", fileURL.string());
  stream.open();
  if (fileStream->streamStatus() == StreamStatus::error) {
    log().error("error opening output stream");
    removeQuietly(fileURL);
    return std::nullopt;
  }
  bool serialised = true;
  {
    CompressedStreamBuf buffer(stream);
    std::ostream out(&buffer);
    try {
      out << dictionary;
      out.flush();
    } catch (const nlohmann::json::exception& e) {
      // Strings that are not UTF-8 cannot be written as JSON.
      log().error("Session didn't serialize properly to JSON: {}", e.what());
      serialised = false;
    }
  }
  stream.close();
  if (!serialised) {
    removeQuietly(fileURL);
    return std::nullopt;
  }
  if (!fileManager_.exists(fileURL)) {
    log().error("Couldn't find file {} after compression.", fileURL.string());
    return std::nullopt;
  }
  HttpRequest request;
  try {
    request = feedbackUploadRequest(*endpoint, std::string(FBFStrings::VireonFeedbackType));
  } catch (const VireonURLRequestBuilder::URLError&) {
    log().error("feedbackUploadRequest failed because of bad url.");
    return std::nullopt;
  }
  setHeader(request, FBFStrings::HTTPHeaders::Digest, stream.dataDigestForStream());
  log().debug("JSON vireon feedback upload to {}", request.url.empty() ? "unknown?" : request.url);
  return UploadRequest{std::move(request), fileURL, stream.uncompressedBytesWritten(), stream.compressedBytesWritten(),
                       std::string(FBFStrings::VireonFeedbackType)};
}

std::optional<UploadRequest> UploadManager::uploadCustomFeedback(const fs::path& fileURL, const std::string& type) {
  log().debug("Flushing Custom Feedback.");
  auto endpoint = bag_ ? endpointForCustomType(*bag_, type) : std::nullopt;
  if (!endpoint || !knownFeedbackTypeFromName(type, true)) {
    log().error("Feedback endpoint or appropriate type not set, data can't be sent to server.");
    return std::nullopt;
  }
  log().debug("uploadFile: {}.", fileURL.string());
  auto file = makeFileForCompressedCustomFeedback(fileURL);
  if (!file) {
    log().error("Error getting temp file.");
    return std::nullopt;
  }
  auto& [fd, outURL] = *file;
  std::error_code ec;
  FileDescriptor input = fileManager_.openForReading(fileURL, ec);
  if (!input.valid()) {
    // Links and files that are not ours are never read.
    log().error("Couldn't open custom feedback file {}: {}", fileURL.string(), ec.message());
    removeQuietly(outURL);
    return std::nullopt;
  }
  auto fileStream = std::make_shared<FileOutputStream>(std::move(fd));
  CompressedOutputStream stream(fileStream);
  stream.open();
  std::array<uint8_t, 8192> buffer{};
  bool readFailed = false;
  while (true) {
    ssize_t n = ::read(input.get(), buffer.data(), buffer.size());
    if (n < 0 && errno == EINTR) continue;
    if (n < 0) {
      readFailed = true;
      ec = std::error_code(errno, std::generic_category());
      break;
    }
    if (n == 0) break;
    stream.write(buffer.data(), static_cast<size_t>(n));
  }
  input.reset();
  stream.close();
  if (readFailed) {
    log().error("Couldn't open custom feedback file {}: {}", fileURL.string(), ec.message());
    removeQuietly(outURL);
    return std::nullopt;
  }
  HttpRequest request;
  try {
    request = feedbackUploadRequest(*endpoint, type);
  } catch (const VireonURLRequestBuilder::URLError&) {
    log().error("feedbackUploadRequest failed because of bad url.");
    return std::nullopt;
  }
  setHeader(request, FBFStrings::HTTPHeaders::Digest, stream.dataDigestForStream());
  log().debug("Custom upload to {}", request.url);
  return UploadRequest{std::move(request), outURL, stream.uncompressedBytesWritten(), stream.compressedBytesWritten(),
                       type};
}

// ---- sending ----

void UploadManager::enqueue(UploadRequest request, UploadCompletion completion) {
  log().debug("Enqueueing {} for upload", request.fileURL.filename().string());
  auto core = core_;
  auto fileURL = request.fileURL;
  auto typeString = request.typeString;
  ++core->inFlight;
  if (!uploadSession_) {
    HttpError error{HttpErrorDomain::other, HttpErrorCode::other, "no upload session is available"};
    log().error("{} upload failed: {}", typeString, error.description);
    assembly_.workloop().async([core, fileURL, typeString, error, completion = std::move(completion)]() mutable {
      core->taskDidComplete(fileURL, typeString, std::nullopt, error, completion);
    });
    return;
  }
  uploadSession_->uploadFile(
      std::move(request.request), request.fileURL,
      [core, fileURL, typeString, completion = std::move(completion)](std::optional<HttpResponse> response,
                                                                      std::optional<HttpError> error) {
        core->taskDidComplete(fileURL, typeString, std::move(response), std::move(error), completion);
      });
}

size_t UploadManager::uploadsInFlight() const { return core_->inFlight; }

bool UploadManager::fileWasCreatedInTheLast(int64_t maxAgeDays, SystemTime creation, SystemTime now) {
  int64_t age = std::chrono::duration_cast<std::chrono::seconds>(now - creation).count();
  int64_t limit;
  if (__builtin_mul_overflow(maxAgeDays, FBFConstants::SecondsPerDay, &limit)) FBF_FATAL("age limit overflow");
  return limit > age;
}

bool UploadManager::fileWasCreatedInTheLast(const fs::path& file, int64_t maxAgeDays) {
  auto attributes = fileManager_.attributes(file);
  if (!attributes) return false;
  return fileWasCreatedInTheLast(maxAgeDays, attributes->creationDate, assembly_.currentDate());
}

void UploadManager::retryUpload(const fs::path& fileURL, const std::string& typeString) {
  int64_t maxAge = FBFConstants::DefaultFeedbackMaxAgeInDays;
  if (bag_) maxAge = bag_->feedbackMaxAgeInDays().value_or(maxAge);

  if (fileWasCreatedInTheLast(fileURL, maxAge)) {
    auto endpoint = bag_ ? bag_->feedbackURL() : std::nullopt;
    if (typeString == "Crowdsourcing" && bag_) endpoint = endpointForCustomType(*bag_, typeString);
    if (!endpoint) {
      log().error("feedback uploader found no upload endpoint from defaults.");
      return;
    }
    log().debug("Retry upload of {}.", fileURL.filename().string());
    HttpRequest request;
    try {
      request = feedbackUploadRequest(*endpoint, typeString);
    } catch (const VireonURLRequestBuilder::URLError&) {
      log().error("Bad upload url");
      return;
    }
    enqueue(UploadRequest::retryRequest(std::move(request), fileURL, typeString), nullptr);
    return;
  }

  if (auto event = FeedbackDeletionEvent::make(fileURL, feedbackTypeCode(typeString), FeedbackDeletionReason::tooOld,
                                               assembly_.currentDate(), fileManager_)) {
    assembly_.didDeleteFeedbackFile(*event);
  }
  log().info("Discarding rather than retrying upload because file is too old: {}.", fileURL.filename().string());
  std::error_code ec;
  if (!fileManager_.removeItem(fileURL, ec)) log().error("error removing session file");
}

}  // namespace fbf
