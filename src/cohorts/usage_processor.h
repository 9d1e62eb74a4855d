// Counts the usage of each processed search session into the usage event
// store: a session sentinel (a VIRUsageEvent with its category) for every
// session that counts as usage, and one counter record for the session's
// surface.
//
// A session counts as usage when it has at least one engagement and either
// comes from the messaging surface (3) or has at least one search (a search
// start with typed input). Its surface comes from its agent: "wayfin" 1,
// "scoutlume" 2, "news" 4, "messages" 3, in that order of testing, else 0
// (nothing is counted). News sessions get a sentinel but no counter record.
//
// Engagements are the result engagements (for the system search surface
// only those that are not previews, trigger events 3, 8, 9, and whose
// destination is not 1), did-go-to-site feedback (browser only) and
// did-go-to-search feedback (browser and system search). Each lands in
// exactly one counter; the first matching row decides. "result" is the
// engaged result; "section" its knownSectionBundleIdentifier; "bundle" its
// knownResultBundleId; "goto" means the trigger event was the return key (4).
//
// System search surface (VIRScoutlumeSession):
//   | engagement                     | test                        | counter                   |
//   |--------------------------------|-----------------------------|---------------------------|
//   | did-go-to-search               |                             | vireon                    |
//   | result engagement, no result   |                             | other                     |
//   | result engagement              | bundle 44, 66 or 86         | querySuggestion           |
//   | result engagement              | section 102                 | vexaSuggestions           |
//   | result engagement              | section 103                 | onDeviceAddressBookData   |
//   | result engagement              | section 104 to 109          | onDeviceOtherPersonalData |
//   | result engagement              | isLocalApplicationResult    | appLaunch                 |
//   | result engagement              | section 110                 | thirdPartyInAppContent    |
//   | result engagement              | section 100                 | vireon                    |
//   | result engagement              | the result has a punchout   | punchout                  |
//   | anything else                  |                             | other                     |
//
// Browser surface (VIRWayfinSession):
//   | engagement                     | test                        | counter                   |
//   |--------------------------------|-----------------------------|---------------------------|
//   | did-go-to-site                 |                             | goToSite                  |
//   | did-go-to-search               |                             | thirdPartyGoto            |
//   | result engagement, no result   |                             | other                     |
//   | result engagement              | bundle 44, 66 or 86         | thirdPartyCompletionOrRecentSearch |
//   | result engagement              | isLocalApplicationResult or section 111 to 113 | localGoto / localTap |
//   | result engagement              | section 100                 | vireonGoto / vireonTap    |
//   | result engagement              | section 114                 | thirdPartyGoto / thirdPartyTap |
//   | anything else                  |                             | other                     |
//
// Images, from the messaging surface (VIRImagesSession), by the result found
// under the engaged result's identifier among all results of the session:
//   | found result                   | test                        | counter                   |
//   |--------------------------------|-----------------------------|---------------------------|
//   | yes                            | bundle 44, 66 or 86         | querySuggestion           |
//   | yes                            | section 101                 | zkw                       |
//   | yes                            |                             | image                     |
//   | no (no result or identifier)   |                             | other                     |
//   `recentResult` is never incremented by this classification.
//
// Section codes: 100 server (Vireon) results, 101 zero-keyword suggestions,
// 102 assistant suggestions, 103 contacts, 104 mail, 105 messages, 106 notes,
// 107 calendar, 108 files, 109 photos, 110 third-party in-app content,
// 111 bookmarks, 112 history, 113 open tabs, 114 third-party search engine.
//
// A session is counted once: its fingerprint (agent, user, start, and the
// query, type, kind and time of each feedback item: what tells one session
// file from another) is saved with its records, and a session whose
// fingerprint is already in the store (processed again after a crash that
// came before its file was deleted) is not counted again.
//
// A counter that would pass 32767 stops the process (a session cannot hold
// that many engagements of one kind unless its file is corrupt).
//
// Thread-safety: `reportUsageEvents` may be called from any queue; the
// writes run on the store's context queue, after the call returns, so a read
// through that queue sees them. A crash between the report and the write
// loses that session's count only if its upload also finished in that
// moment; otherwise the session is processed, and counted, again. Holds the
// store without owning it.
#pragma once

#include "cohorts/usage_store.h"
#include "corevireon.pb.h"
#include "flushing/flushable_session.h"
#include "flushing/reporters.h"
#include "platform/task_queue.h"

#include <chrono>
#include <memory>
#include <mutex>
#include <optional>
#include <vector>

namespace fbf {

namespace usage {

// The session's surface is `cohortsClient` of flushing/reporters.h; which
// feedback is an engagement or a search is decided by its EngagementReporter
// and KeystrokeReporter.

inline constexpr int32_t kQuerySuggestionResultBundleIds[] = {44, 66, 86};
inline constexpr int32_t kSectionVireonServer = 100;
inline constexpr int32_t kSectionZeroKeyword = 101;
inline constexpr int32_t kSectionVexaSuggestions = 102;
inline constexpr int32_t kSectionContacts = 103;
inline constexpr int32_t kSectionOnDevicePersonalFirst = 104;
inline constexpr int32_t kSectionOnDevicePersonalLast = 109;
inline constexpr int32_t kSectionThirdPartyInAppContent = 110;
inline constexpr int32_t kSectionBrowserLocalFirst = 111;
inline constexpr int32_t kSectionBrowserLocalLast = 113;
inline constexpr int32_t kSectionThirdPartySearch = 114;

}  // namespace usage

// The flushable session counts usage through this interface.
using UsageProcessorProtocol = UsageEventSink;

class UsageProcessor final : public UsageProcessorProtocol {
 public:
  explicit UsageProcessor(DataStorageContainerProtocol& persistentStore);
  // Waits until everything reported is written.
  ~UsageProcessor() override;
  UsageProcessor(const UsageProcessor&) = delete;
  UsageProcessor& operator=(const UsageProcessor&) = delete;

  // Works out what the session counts for on the caller's thread, then
  // hands that to the store's queue, which writes the sessions reported
  // since its last write in one transaction and resets the context, so no
  // staged record stays in memory. Writes are coalesced: once
  // `kBatchSessions` are waiting, or `kBatchDelay` after the first. One
  // commit per session rewrote the same pages into the write-ahead log
  // each time and woke the store's thread per file, about 5 % of a flush's
  // CPU. A crash can lose the counts of one batch whose files were
  // already uploaded: an undercount, never a double count.
  void reportUsageEvents(const corevireon::CVClientSession& session) override;
  // Writes what is waiting and returns when it is written; anything that
  // reads the store for a report calls this first.
  void writePending();

  static constexpr size_t kBatchSessions = 64;
  static constexpr std::chrono::milliseconds kBatchDelay{500};

  // The usage rule on flags.
  static bool session(bool withSearches, bool engagements, corevireon::CVClient countsAsUsageFor);

 private:
  // What one session adds to the store: a sentinel for `client` and, for
  // the surfaces with a counter record, one counter index per engagement.
  struct SessionUsage {
    corevireon::CVClient client;
    int64_t fingerprint;
    double sessionStart;
    std::vector<size_t> counters;
  };
  // None when the session does not count as usage.
  static std::optional<SessionUsage> usageOf(const corevireon::CVClientSession& session);
  // On the store's queue.
  void drain();
  bool alreadyCounted(int64_t fingerprint);
  void stage(const SessionUsage& usage);

  DataStorageContainerProtocol& persistentStore_;
  std::mutex mutex_;
  std::unique_ptr<Timer> drainTimer_;  // on the store's queue
  std::vector<SessionUsage> pending_;  // guarded by mutex_
  bool drainPosted_ = false;           // guarded by mutex_
  bool timerArmed_ = false;            // guarded by mutex_
};

}  // namespace fbf
