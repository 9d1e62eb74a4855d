// One flush: walks the pending session and custom feedback files one at a
// time on the work queue, checks each against the age and size limits,
// post-processes sessions for privacy, hands payloads to the upload manager,
// and at the end flushes the cohort feedback, prunes the session directory
// and calls its completion exactly once.
//
// The walk is bounded: it takes the next file only while fewer than
// `kMaximumUploadsInFlight` uploads are being compressed, queued or in flight
// (at most `kMaximumPreparations` of them compressed at once), and resumes
// from each completion, so memory, descriptors and the work waiting on the
// queue do not grow with the backlog on disk, and completions (delete after
// 200, loss events) run promptly between files. A session is compressed while
// the walk processes the next one, on the upload manager's encoder where it
// has one. Uploads left by earlier runs are retried first, oldest first.
//
// A claimed file is removed only once its payload is safe: after its upload
// answered 200, or after a batched file-system sync has made its upload file
// durable (one sync per `kSessionRemovalBatch` files and at the end of the
// walk), so a crash or power cut never loses both. A failure that is not the
// file's own fault (no usable endpoint, no upload file, a read error) returns
// a claimed session to "closed"; with no usable endpoint files are not
// claimed at all.
//
// The completion comes when the walk has finished AND every upload the flush
// enqueued has reached its outcome, so a client that asked for a flush knows
// the data has really gone (or not). Pruning runs after that, and never counts
// or removes an upload this flush queued. Files that cannot be sent stay on
// disk for the next flush; every file the flusher drops is reported as a
// deletion event first.
//
// Lives on the assembly's work queue; made and kept by a shared_ptr (pending
// work holds it alive). `stopEnumeratingFeedback` may be called from any
// thread.
#pragma once

#include "assembly/age_limit.h"
#include "assembly/fbf_assembly_protocol.h"
#include "flushing/feedback_enumerator.h"
#include "flushing/upload_manager_protocol.h"
#include "util/signpost.h"

#include <atomic>
#include <deque>
#include <map>
#include <functional>
#include <memory>
#include <optional>
#include <set>
#include <string>
#include <vector>

namespace fbf {

class UsageEventSink;

// The usage store as one flush uses it; absent when the store cannot be
// brought up (then no usage is counted and no cohorts are generated).
class FlushUsageStore {
 public:
  virtual ~FlushUsageStore() = default;
  virtual UsageEventSink* usageEventSink() = 0;
  // At the end of the walk: every due period aggregated into "Usage" files.
  virtual void flushCohortsFeedback() = 0;
  // When the flusher goes away.
  virtual void resetRowCache() = 0;
};

struct FlusherDependencies {
  UploadManagerFactory uploadManagerFactory;
  // Optional.
  std::function<std::unique_ptr<FlushUsageStore>(FBFAssemblyProtocol&)> usageStoreFactory;
  // Injectable for tests; the system draw by default.
  RandomChoice randomChoice = systemRandomChoice();
};

class FeedbackFlusher final : public UploadManagerDelegate, public std::enable_shared_from_this<FeedbackFlusher> {
 public:
  static constexpr int kMaximumNumberOfFeedbackFiles = 100;
  // Uploads queued or in flight before the walk waits: enough for HTTP/2
  // streams to hide a slow server's latency, few enough to hold little.
  static constexpr size_t kMaximumUploadsInFlight = 64;
  // Payloads handed over for compression and not back yet: one being
  // compressed and one waiting keep the encoder busy without holding more.
  static constexpr size_t kMaximumPreparations = 2;
  static constexpr size_t kSessionRemovalBatch = 64;

  static std::shared_ptr<FeedbackFlusher> make(FBFAssemblyProtocol& assembly, FlusherDependencies deps);
  ~FeedbackFlusher() override;

  // An empty list flushes every type (and the session files).
  void beginEnumeratingFeedback(std::vector<std::string> types, std::function<void()> completion);
  void beginEnumeratingFeedback(std::function<void()> completion) { beginEnumeratingFeedback({}, std::move(completion)); }
  // The walk ends after the file in progress.
  void stopEnumeratingFeedback();
  // Processes one session file now (a closed one is processed, one left with
  // an upload suffix is retried), then completes.
  void flushSessionEagerly(const fs::path& url, std::function<void()> completion);

  void uploadManagerDidUploadFile(const fs::path& file, long status) override;

  // Limits from the bag the flusher was made with.
  uint64_t sizeLimitFor(const std::string& type) const;
  static const std::vector<std::string>& customFeedbackTypesWithPrivacyExceptions();

 private:
  FeedbackFlusher(FBFAssemblyProtocol& assembly, FlusherDependencies deps);

  void flushNext();
  std::optional<FeedbackFile> nextFile();
  void flushFeedbackFile(const FeedbackFile& file);
  void postProcessAndUpload(const FeedbackFile& file);
  void sessionUploadPrepared(const fs::path& path, const std::string& typeString, uint64_t fileSize,
                             std::optional<UploadRequest> request);
  bool hasRoom() const;
  // After a completion: takes the next file if the walk waits for room, or
  // ends a walk that waited for its last preparation.
  void resumeWalk();
  void validateAndUploadCustomFeedback(const FeedbackFile& file);
  void retryPendingUpload(const FeedbackFile& file);
  void checkAgeOfPoisonFile(const FeedbackFile& file);
  // Processing -> closed after a failure that is not the file's own fault.
  void returnToClosed(const fs::path& processing);
  void enqueue(UploadRequest request, uint64_t fileSize, const fs::path& source);
  void tee(const std::string& payload, const std::string& format);
  void discardFeedback(const fs::path& file, int typeCode, int32_t reason,
                       std::string_view failureMessage = "error removing feedback file");
  bool createdWithinMaxAge(SystemTime creation) const;
  // The source of an upload that got its 200, or whose upload file is durable.
  void retireSource(const fs::path& source);
  void syncAndRetireSources();
  void collectPendingUploads(const std::vector<std::string>& types);
  void enumeratingFeedbackDidFinish();
  void pruneSessionFiles(int maximum);
  void completeWhenUploadsSettle();

  FBFAssemblyProtocol& assembly_;
  FlusherDependencies deps_;
  std::optional<ConfigurationBag> bag_;
  std::unique_ptr<UploadManagerProtocol> uploadManager_;
  std::unique_ptr<FlushUsageStore> usageStore_;
  std::optional<FeedbackEnumerator> feedbackEnumerator_;
  std::function<void()> enumerationCompletion_;
  std::unique_ptr<SignpostInterval> flushInterval_;
  FeedbackAgeLimit ageLimit_;
  bool leaveFeedbackAfterUpload_ = false;
  bool walkFinished_ = false;
  bool walkWaiting_ = false;  // the walk waits for a preparation or an upload to complete
  bool walkEnding_ = false;   // the walk is over but preparations are outstanding
  size_t preparationsInFlight_ = 0;
  bool pruneWhenSettled_ = false;  // a full or typed flush prunes; an eager one does not
  // Uploads left by earlier runs, oldest first; retried before the walk.
  std::deque<FeedbackFile> pendingUploads_;
  // Upload files this flush queued that still exist (in flight or failed):
  // pruning leaves them alone.
  std::set<fs::path> queuedUploads_;
  // Upload file -> the claimed file it was made from, until one is retired.
  std::map<fs::path, fs::path> sourcesAwaitingSafety_;
  // Sessions returned to "closed" twice by start-up recovery.
  std::set<std::string> poisonSessionIDs_;
  std::atomic<bool> stopRequested_{false};
};

}  // namespace fbf
