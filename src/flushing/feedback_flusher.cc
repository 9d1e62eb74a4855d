#include "flushing/feedback_flusher.h"

#include "assembly/cache_paths.h"
#include "assembly/fbf_strings.h"
#include "assembly/feedback_types.h"
#include "corevireon.pb.h"
#include "flushing/cache_layout.h"
#include "flushing/flushable_session.h"
#include "flushing/session_payload.h"
#include "platform/logging.h"

#include <algorithm>

namespace fbf {
namespace {

spdlog::logger& log() { return logging::get("FeedbackFlusher"); }

std::optional<std::string> readWholeFile(FileManager& fm, const fs::path& path) {
  std::error_code ec;
  return fm.readFile(path, ec);
}

}  // namespace

std::shared_ptr<FeedbackFlusher> FeedbackFlusher::make(FBFAssemblyProtocol& assembly, FlusherDependencies deps) {
  return std::shared_ptr<FeedbackFlusher>(new FeedbackFlusher(assembly, std::move(deps)));
}

FeedbackFlusher::FeedbackFlusher(FBFAssemblyProtocol& assembly, FlusherDependencies deps)
    : assembly_(assembly), deps_(std::move(deps)), bag_(assembly.cachedBag()) {
  if (deps_.uploadManagerFactory) uploadManager_ = deps_.uploadManagerFactory(assembly_);
  if (uploadManager_) uploadManager_->setDelegate(this);
}

FeedbackFlusher::~FeedbackFlusher() {
  if (uploadManager_) uploadManager_->setDelegate(nullptr);
  if (usageStore_) {
    usageStore_->resetRowCache();
    log().debug("Emptied the ObjectGraph row cache.");
  }
}

const std::vector<std::string>& FeedbackFlusher::customFeedbackTypesWithPrivacyExceptions() {
  // A report the user chose to send carries its own consent.
  static const std::vector<std::string> types = {"UserReport"};
  return types;
}

int64_t FeedbackFlusher::feedbackMaxAgeInDays() const {
  if (bag_) {
    if (auto v = bag_->feedbackMaxAgeInDays()) return *v;
  }
  return FBFConstants::DefaultFeedbackMaxAgeInDays;
}

uint64_t FeedbackFlusher::sizeLimitFor(const std::string& type) const {
  if (bag_) {
    auto sizes = bag_->maxCustomFeedbackSizes();
    if (auto it = sizes.find(type); it != sizes.end()) return it->second;
  }
  return FBFConstants::DefaultMaxSessionFileSize;
}

bool FeedbackFlusher::createdWithinMaxAge(SystemTime creation) const {
  int64_t maxAge = 0;
  if (__builtin_mul_overflow(feedbackMaxAgeInDays(), FBFConstants::SecondsPerDay, &maxAge)) return false;
  double age = std::chrono::duration<double>(assembly_.currentDate() - creation).count();
  return static_cast<double>(maxAge) > age;
}

void FeedbackFlusher::beginEnumeratingFeedback(std::vector<std::string> types, std::function<void()> completion) {
  auto self = shared_from_this();
  assembly_.workloop().async([self, types = std::move(types), completion = std::move(completion)]() mutable {
    self->enumerationCompletion_ = std::move(completion);
    self->flushInterval_ = std::make_unique<SignpostInterval>("flush");
    // An offline cancellation ends the flush it happened in, not this one.
    if (self->assembly_.isCancelled() && !self->assembly_.isTerminating()) self->assembly_.setCancelled(false);
    if (self->bag_) {
      vireon_cleanup(self->assembly_.fileManager(), self->assembly_.currentDate());
      if (self->deps_.usageStoreFactory) self->usageStore_ = self->deps_.usageStoreFactory(self->assembly_);
    }
    self->feedbackEnumerator_ = FeedbackEnumerator::make(self->assembly_, std::move(types), self->deps_.randomChoice);
    if (!self->feedbackEnumerator_) log().error("Cannot locate the cache directory; nothing to flush");
    self->flushNext();
  });
}

void FeedbackFlusher::stopEnumeratingFeedback() {
  stopRequested_ = true;
  auto self = shared_from_this();
  assembly_.workloop().async([self] {
    if (self->feedbackEnumerator_) self->feedbackEnumerator_->finish();
  });
}

void FeedbackFlusher::flushNext() {
  auto self = shared_from_this();
  assembly_.workloop().async([self] {
    if (!self->bag_) {
      log().info("Flusher didn't find a cached bag, bailing on this flush");
      self->enumeratingFeedbackDidFinish();
      return;
    }
    if (!self->feedbackEnumerator_ || self->stopRequested_ || !self->assembly_.shouldProceed()) {
      self->enumeratingFeedbackDidFinish();
      return;
    }
    auto file = self->feedbackEnumerator_->next();
    if (!file) {
      self->enumeratingFeedbackDidFinish();
      return;
    }
    self->flushFeedbackFile(*file);
    self->flushNext();
  });
}

void FeedbackFlusher::flushFeedbackFile(const FeedbackFile& file) {
  if (file.uploadPending()) {
    retryPendingUpload(file);
  } else if (file.fileType == FeedbackFileType::session) {
    // Open files belong to a writer; processing and uploaded ones are left
    // as they are.
    if (file.sessionFilename && file.sessionFilename->state == SessionFileState::closed) postProcessAndUpload(file);
  } else if (file.fileType == FeedbackFileType::custom) {
    validateAndUploadCustomFeedback(file);
  }
}

void FeedbackFlusher::retryPendingUpload(const FeedbackFile& file) {
  // The walk may come across the upload files this flush has just made.
  if (enqueuedFiles_.count(file.fileURL)) return;
  if (assembly_.isCancelled()) {
    log().debug("Flushing is cancelled, skipping {}.", file.fileName());
    return;
  }
  if (uploadManager_) uploadManager_->retryUpload(file.fileURL, file.typeString());
}

void FeedbackFlusher::postProcessAndUpload(const FeedbackFile& file) {
  auto& fm = assembly_.fileManager();
  std::error_code ec;
  auto processing = vireon_renameForStateChange(fm, file.fileURL, SessionFileState::processing, ec);
  if (!processing) {
    log().error("Error trying to move file {} to processing state: {}", file.fileURL.string(), ec.message());
    return;
  }
  const fs::path path = *processing;
  const std::string name = path.filename().string();

  auto attrs = fm.attributes(path);
  if (!attrs) {
    log().error("Couldn't retrieve file attributes for session {}.", name);
    if (!fm.removeItem(path, ec)) log().error("Couldn't get file attributes but deletion failed");
    return;
  }
  const int protobufType = *knownFeedbackTypeFromName(FBFStrings::VireonProtobufFeedbackType);
  if (!createdWithinMaxAge(attrs->creationDate)) {
    log().info("Discarding session because it's too old: {}.", name);
    discardFeedback(path, protobufType, FeedbackDeletionReason::tooOld);
    return;
  }
  const uint64_t rawLimit = sizeLimitFor(std::string(FBFStrings::VireonProtobufFeedbackType));
  if (attrs->size > rawLimit) {
    log().info("Discarding vireon session {} because size exceeds maximum size {}KB", name, rawLimit / 1024);
    discardFeedback(path, protobufType, FeedbackDeletionReason::tooLarge, "File's too large but deletion failed");
    return;
  }

  auto bytes = readWholeFile(fm, path);
  if (!bytes) {
    log().error("Couldn't open file for reading.");
    return;
  }

  const bool protobufFormat = bag_ && bag_->vireonFeedbackFormat() == FBFStrings::VireonProtobufFeedbackType;
  const std::string typeString(protobufFormat ? FBFStrings::VireonProtobufFeedbackType : FBFStrings::VireonFeedbackType);
  std::optional<UploadRequest> request;
  {
    std::string guid = file.sessionFilename ? file.sessionFilename->sessionIDString() : name;
    SignpostInterval serialize("serialize session", ("file GUID:" + guid).c_str());
    corevireon::CVClientSession session;
    if (!session.ParseFromString(*bytes)) {
      log().error("File contents did not deserialize into a _CVClientSession");
      return;
    }
    if (!session.has_feedbacks() || session.feedbacks().items_size() == 0) {
      log().error("Deserialized session contained no feedback.");
      return;
    }
    FlushableSession flushable(std::move(session));
    flushable.postProcessFeedback(usageStore_ ? usageStore_->usageEventSink() : nullptr);
    if (!uploadManager_) return;
    if (protobufFormat) {
      if (assembly_.uploadListener()) tee(serializeSessionDeterministically(flushable.backingStore()), typeString);
      request = uploadManager_->uploadProtobufFeedback(flushable.backingStore(), path);
    } else {
      auto json = flushable.generateSessionJSON();
      if (assembly_.uploadListener()) tee(json.dump(), typeString);
      request = uploadManager_->uploadJSONFeedback(json, path);
    }
  }
  if (!request) return;

  // The processed payload has its own limit under its feedback type.
  const uint64_t processedLimit = sizeLimitFor(typeString);
  if (static_cast<uint64_t>(request->uncompressedSize) > processedLimit) {
    log().info("Discarding vireon session {} because size exceeds maximum size {}KB", name, processedLimit / 1024);
    vireon_removeItemOrLogError(fm, request->fileURL, "error removing upload file");
    discardFeedback(path, protobufType, FeedbackDeletionReason::tooLarge);
    return;
  }

  {
    SignpostInterval upload("upload");
    enqueue(std::move(*request), attrs->size);
  }

  // The payload now lives in the upload file; the session file has served.
  if (assembly_.userDefaults().boolForKey(FBFStrings::Defaults::LeaveFeedbackAfterUpload)) {
    if (!vireon_renameForStateChange(fm, path, SessionFileState::uploaded, ec)) {
      log().error("Error trying to move file to uploaded state for LeaveFeedbackAfterUpload: {}", ec.message());
    }
  } else if (!fm.removeItem(path, ec)) {
    log().error("Error removing session file after flush");
  }
}

void FeedbackFlusher::validateAndUploadCustomFeedback(const FeedbackFile& file) {
  auto& fm = assembly_.fileManager();
  const std::string type = file.typeString();
  const int typeCode = file.knownFeedbackType();
  log().debug("Flushing {}.", type);
  std::error_code ec;
  auto attrs = fm.attributes(file.fileURL);
  if (!attrs) {
    if (!fm.removeItem(file.fileURL, ec) && fm.exists(file.fileURL)) {
      log().error("Couldn't get file attributes but deletion failed");
    }
    return;
  }
  if (attrs->size == 0) {
    log().info("discarding {} custom feedback because it's empty", type);
    discardFeedback(file.fileURL, typeCode, FeedbackDeletionReason::empty);
    return;
  }
  if (attrs->size > sizeLimitFor(type)) {
    log().info("discarding {} custom feedback because it's too big", type);
    discardFeedback(file.fileURL, typeCode, FeedbackDeletionReason::tooLarge);
    return;
  }
  if (!createdWithinMaxAge(attrs->creationDate)) {
    log().info("Discarding custom feedback because it's too old: {}.", file.fileName());
    discardFeedback(file.fileURL, typeCode, FeedbackDeletionReason::tooOld);
    return;
  }
  const auto& exceptions = customFeedbackTypesWithPrivacyExceptions();
  if (!assembly_.isDiagnosticsAndUsageEnabled() &&
      std::find(exceptions.begin(), exceptions.end(), type) == exceptions.end()) {
    log().info("Skipping custom feedback upload because D&U disabled: {}.", file.fileName());
    discardFeedback(file.fileURL, typeCode, FeedbackDeletionReason::noConsent);
    return;
  }
  if (!uploadManager_) return;
  if (assembly_.uploadListener()) {
    if (auto bytes = readWholeFile(fm, file.fileURL)) tee(*bytes, type);
  }
  auto request = uploadManager_->uploadCustomFeedback(file.fileURL, type);
  if (!request) return;
  enqueue(std::move(*request), attrs->size);
  if (!fm.removeItem(file.fileURL, ec)) log().error("Error removing custom feedback file after enqueuing it for upload.");
}

void FeedbackFlusher::tee(const std::string& payload, const std::string& format) {
  if (auto listener = assembly_.uploadListener()) listener->willUploadData(payload, format);
}

void FeedbackFlusher::enqueue(UploadRequest request, uint64_t fileSize) {
  auto self = shared_from_this();
  enqueuedFiles_.insert(request.fileURL);
  std::string type = request.typeString;
  auto size = static_cast<unsigned long>(request.uncompressedSize);
  auto compressed = static_cast<unsigned long>(request.compressedSize);
  uploadManager_->enqueue(std::move(request), [self, type, fileSize, size, compressed](
                                                  std::optional<HttpResponse> response, std::optional<HttpError>) {
    if (response && response->statusCode == 200) {
      log().debug("uploaded {}", size);
    } else {
      log().debug("error");
    }
    vireon_signpost_feedbackUpload(type.c_str(), static_cast<unsigned long>(fileSize), size, compressed);
  });
}

void FeedbackFlusher::discardFeedback(const fs::path& file, int typeCode, int32_t reason,
                                      std::string_view failureMessage) {
  auto& fm = assembly_.fileManager();
  // Built before the removal: it needs the file's size and age.
  auto event = FeedbackDeletionEvent::make(file, typeCode, reason, assembly_.currentDate(), fm);
  std::error_code ec;
  if (!fm.removeItem(file, ec)) {
    log().error("{}: {}", failureMessage, ec.message());
    return;
  }
  if (event) assembly_.didDeleteFeedbackFile(*event);
}

void FeedbackFlusher::enumeratingFeedbackDidFinish() {
  if (walkFinished_) return;
  walkFinished_ = true;
  log().debug("flush complete, cleaning up");
  flushInterval_.reset();
  if (usageStore_) usageStore_->flushCohortsFeedback();
  if (bag_) pruneSessionFiles(kMaximumNumberOfFeedbackFiles);
  feedbackEnumerator_.reset();
  completeWhenUploadsSettle();
}

void FeedbackFlusher::pruneSessionFiles(int maximum) {
  auto& fm = assembly_.fileManager();
  vireon_pruneSessionFiles(fm, maximum, [this, &fm](const fs::path& file) {
    auto parsed = SessionFilename::fromString(file.filename().string());
    std::string type(parsed ? queryParameterString(parsed->uploadFormat) : FBFStrings::VireonFeedbackType);
    int code = knownFeedbackTypeFromName(type).value_or(0);
    if (auto event = FeedbackDeletionEvent::make(file, code, FeedbackDeletionReason::pruned, assembly_.currentDate(), fm)) {
      assembly_.didDeleteFeedbackFile(*event);
    }
  });
}

void FeedbackFlusher::uploadManagerDidUploadFile(const fs::path&, long) {
  if (walkFinished_) completeWhenUploadsSettle();
}

void FeedbackFlusher::completeWhenUploadsSettle() {
  if (!enumerationCompletion_) return;
  if (uploadManager_ && uploadManager_->uploadsInFlight() > 0) return;
  auto completion = std::move(enumerationCompletion_);
  enumerationCompletion_ = nullptr;
  completion();
}

void FeedbackFlusher::flushSessionEagerly(const fs::path& url, std::function<void()> completion) {
  auto self = shared_from_this();
  assembly_.workloop().async([self, url, completion = std::move(completion)]() mutable {
    self->enumerationCompletion_ = std::move(completion);
    if (self->assembly_.isCancelled() && !self->assembly_.isTerminating()) self->assembly_.setCancelled(false);
    auto attrs = self->assembly_.fileManager().attributes(url);
    if (!self->bag_) {
      log().info("Flusher didn't find a cached bag, bailing on this flush");
    } else if (attrs && attrs->isRegular()) {
      self->flushFeedbackFile(FeedbackFile(url, attrs));
    }
    self->walkFinished_ = true;
    self->completeWhenUploadsSettle();
  });
}

}  // namespace fbf
