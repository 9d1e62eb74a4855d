#include "cohorts/usage_processor.h"

#include "flushing/feedback_capabilities.h"
#include "platform/logging.h"

#include <algorithm>
#include <map>
#include <set>
#include <string>
#include <variant>

namespace fbf {
namespace {

using corevireon::CVClient;
using corevireon::CVSearchResultForFeedback;

bool isQuerySuggestion(const CVSearchResultForFeedback& r) {
  const auto& ids = usage::kQuerySuggestionResultBundleIds;
  return std::find(std::begin(ids), std::end(ids), r.knownresultbundleid()) != std::end(ids);
}

bool inRange(int32_t v, int32_t first, int32_t last) { return first <= v && v <= last; }

bool isDidGoToSite(const EngagementReporter& e) {
  return std::holds_alternative<const corevireon::CVDidGoToSiteFeedback*>(e.feedback());
}
bool isDidGoToSearch(const EngagementReporter& e) {
  return std::holds_alternative<const corevireon::CVDidGoToSearchFeedback*>(e.feedback());
}
// The engaged result of a result engagement; null for the other kinds and
// for an engagement without a result.
const CVSearchResultForFeedback* engagedResult(const EngagementReporter& e) {
  const auto* engagement = e.resultEngagement();
  return engagement && engagement->has_result() ? &engagement->result() : nullptr;
}

size_t scoutlumeCounter(const EngagementReporter& e) {
  using C = VIRScoutlumeSession;
  if (isDidGoToSearch(e)) return C::vireon;
  const auto* result = engagedResult(e);
  if (!result) return C::other;
  const auto& r = *result;
  int32_t section = r.knownsectionbundleidentifier();
  if (isQuerySuggestion(r)) return C::querySuggestion;
  if (section == usage::kSectionVexaSuggestions) return C::vexaSuggestions;
  if (section == usage::kSectionContacts) return C::onDeviceAddressBookData;
  if (inRange(section, usage::kSectionOnDevicePersonalFirst, usage::kSectionOnDevicePersonalLast)) {
    return C::onDeviceOtherPersonalData;
  }
  if (r.islocalapplicationresult()) return C::appLaunch;
  if (section == usage::kSectionThirdPartyInAppContent) return C::thirdPartyInAppContent;
  if (section == usage::kSectionVireonServer) return C::vireon;
  if (r.has_punchout()) return C::punchout;
  return C::other;
}

size_t wayfinCounter(const EngagementReporter& e) {
  using C = VIRWayfinSession;
  if (isDidGoToSite(e)) return C::goToSite;
  if (isDidGoToSearch(e)) return C::thirdPartyGoto;
  const auto* result = engagedResult(e);
  if (!result) return C::other;
  const auto& r = *result;
  int32_t section = r.knownsectionbundleidentifier();
  bool viaReturnKey = e.resultEngagement()->triggerevent() == corevireon::CV_TRIGGER_ENGAGEMENT_EVENT_RETURN_KEY;
  if (isQuerySuggestion(r)) return C::thirdPartyCompletionOrRecentSearch;
  if (r.islocalapplicationresult() || inRange(section, usage::kSectionBrowserLocalFirst, usage::kSectionBrowserLocalLast)) {
    return viaReturnKey ? C::localGoto : C::localTap;
  }
  if (section == usage::kSectionVireonServer) return viaReturnKey ? C::vireonGoto : C::vireonTap;
  if (section == usage::kSectionThirdPartySearch) return viaReturnKey ? C::thirdPartyGoto : C::thirdPartyTap;
  return C::other;
}

size_t imagesCounter(const EngagementReporter& e, const std::map<std::string, const CVSearchResultForFeedback*>& results) {
  using C = VIRImagesSession;
  const auto* engaged = engagedResult(e);
  if (!engaged || !engaged->has_identifier()) return C::other;
  auto it = results.find(engaged->identifier());
  if (it == results.end()) return C::other;
  if (isQuerySuggestion(*it->second)) return C::querySuggestion;
  if (it->second->knownsectionbundleidentifier() == usage::kSectionZeroKeyword) return C::zkw;
  return C::image;
}

// FNV-1a, 64 bits.
class Fingerprint {
 public:
  void add(const void* data, size_t size) {
    const auto* p = static_cast<const unsigned char*>(data);
    for (size_t i = 0; i < size; ++i) hash_ = (hash_ ^ p[i]) * 0x100000001b3ULL;
  }
  template <typename T>
  void addValue(T value) {
    add(&value, sizeof value);
  }
  void addString(const std::string& s) {
    addValue(s.size());
    add(s.data(), s.size());
  }
  int64_t value() const { return static_cast<int64_t>(hash_); }

 private:
  uint64_t hash_ = 0xcbf29ce484222325ULL;
};

// What makes a session the same session when a crash has it processed again:
// its agent, user and start, and each payload's query, type, kind and
// timestamp.
int64_t sessionFingerprint(const corevireon::CVClientSession& session) {
  Fingerprint f;
  f.addString(session.agent());
  f.addString(session.userguidstring());
  f.addValue(session.sessionstart());
  f.addValue(session.feedbacks().items_size());
  for (const auto& p : session.feedbacks().items()) {
    f.addValue(p.queryid());
    f.addValue(p.type());
    f.addValue(static_cast<int>(p.codable_case()));
    f.addValue(codableTimestamp(p).value_or(0));
  }
  return f.value();
}

}  // namespace

bool UsageProcessor::session(bool withSearches, bool engagements, CVClient countsAsUsageFor) {
  if (!engagements) return false;
  if (countsAsUsageFor == corevireon::CV_CLIENT_MESSAGING) return true;
  return withSearches && countsAsUsageFor != corevireon::CV_CLIENT_NONE;
}

std::optional<UsageProcessor::SessionUsage> UsageProcessor::usageOf(const corevireon::CVClientSession& session) {
  CVClient client = cohortsClient(session);
  if (client == corevireon::CV_CLIENT_NONE || !session.has_feedbacks()) return std::nullopt;
  bool searches = false;
  std::vector<EngagementReporter> engagements;
  // Each payload's message is found once; the messaging counters walk them
  // again.
  std::vector<const google::protobuf::Message*> messages;
  messages.reserve(static_cast<size_t>(session.feedbacks().items_size()));
  for (const auto& p : session.feedbacks().items()) {
    const google::protobuf::Message* message = codableMessage(p);
    messages.push_back(message);
    if (message == nullptr) continue;
    if (!searches) {
      auto keystroke = KeystrokeReporter::from(*message);
      searches = keystroke && keystroke->isKeystroke();
    }
    auto engagement = EngagementReporter::from(*message);
    if (engagement && engagement->isEngagement(client)) engagements.push_back(std::move(*engagement));
  }
  if (!UsageProcessor::session(searches, !engagements.empty(), client)) return std::nullopt;

  SessionUsage usage{client, sessionFingerprint(session), session.sessionstart(), {}};
  usage.counters.reserve(engagements.size());
  switch (client) {
    case corevireon::CV_CLIENT_WEB_BROWSER:
      for (const auto& e : engagements) usage.counters.push_back(wayfinCounter(e));
      break;
    case corevireon::CV_CLIENT_SYSTEM_SEARCH_UI:
      for (const auto& e : engagements) usage.counters.push_back(scoutlumeCounter(e));
      break;
    case corevireon::CV_CLIENT_MESSAGING: {
      std::map<std::string, const CVSearchResultForFeedback*> resultsById;
      // A later result with the same identifier wins.
      for (const google::protobuf::Message* message : messages) {
        if (message == nullptr) continue;
        for (const auto* r : containedResults(*message)) {
          if (r->has_identifier()) resultsById[r->identifier()] = r;
        }
      }
      for (const auto& e : engagements) usage.counters.push_back(imagesCounter(e, resultsById));
      break;
    }
    default:
      // News and anything else: a sentinel only.
      break;
  }
  return usage;
}

UsageProcessor::UsageProcessor(DataStorageContainerProtocol& persistentStore)
    : persistentStore_(persistentStore), drainTimer_(persistentStore.managedObjectContext().queue().makeTimer()) {}

UsageProcessor::~UsageProcessor() {
  // Whatever was reported is written before the store can go away, and the
  // timer goes on its own queue.
  persistentStore_.managedObjectContext().performAndWait([this] {
    drain();
    drainTimer_.reset();
  });
}

void UsageProcessor::writePending() {
  persistentStore_.managedObjectContext().performAndWait([this] { drain(); });
}

void UsageProcessor::reportUsageEvents(const corevireon::CVClientSession& session) {
  auto usage = usageOf(session);
  if (!usage) return;
  std::lock_guard lock(mutex_);
  pending_.push_back(std::move(*usage));
  auto& context = persistentStore_.managedObjectContext();
  if (pending_.size() >= kBatchSessions) {
    if (!drainPosted_) context.perform([this] { drain(); });
    drainPosted_ = true;
  } else if (!timerArmed_ && !drainPosted_) {
    timerArmed_ = true;
    context.perform([this] { drainTimer_->schedule(kBatchDelay, [this] { drain(); }); });
  }
}

void UsageProcessor::drain() {
  if (drainTimer_) drainTimer_->cancel();
  std::vector<SessionUsage> batch;
  {
    std::lock_guard lock(mutex_);
    batch.swap(pending_);
    drainPosted_ = false;
    timerArmed_ = false;
  }
  if (batch.empty()) return;
  auto& context = persistentStore_.managedObjectContext();
  std::set<int64_t> staged;
  for (const auto& usage : batch) {
    if (staged.count(usage.fingerprint) != 0 || alreadyCounted(usage.fingerprint)) {
      logging::get("UsageProcessor").debug("The usage of this session was counted before; not counted again");
      continue;
    }
    staged.insert(usage.fingerprint);
    stage(usage);
    // Saved in the same transaction as the records just staged.
    context.stageStatement("INSERT OR IGNORE INTO VIRCountedSession (fingerprint, timestamp) VALUES (?, ?)",
                           {SqlValue{usage.fingerprint}, SqlValue{usage.sessionStart}});
  }
  saveOrLogError(context);
  context.reset();
}

bool UsageProcessor::alreadyCounted(int64_t fingerprint) {
  std::string error;
  auto* stmt = persistentStore_.managedObjectContext().database().cached(
      "SELECT 1 FROM VIRCountedSession WHERE fingerprint = ?", &error);
  if (!stmt) {
    logging::get("UsageProcessor").error("Cannot look up counted sessions: {}", error);
    return false;
  }
  stmt->bindAll({SqlValue{fingerprint}});
  bool found = stmt->step() == SqliteStatement::Step::row;
  stmt->reset();
  return found;
}

void UsageProcessor::stage(const SessionUsage& usage) {
  auto& factory = persistentStore_.eventFactory();
  const SystemTime start = timeFromSeconds(usage.sessionStart);
  if (auto event = factory.createUsageEvent()) {
    event->setTimestamp(start);
    if (auto category = event->usageCategory()) category->setClientIntVal(usage.client);
  }
  std::shared_ptr<PropensitySession> record;
  switch (usage.client) {
    case corevireon::CV_CLIENT_WEB_BROWSER:
      record = factory.createWayfinSession();
      break;
    case corevireon::CV_CLIENT_SYSTEM_SEARCH_UI:
      record = factory.createScoutlumeSession();
      break;
    case corevireon::CV_CLIENT_MESSAGING:
      record = factory.createEntity<VIRImagesSession>();
      break;
    default:
      return;
  }
  if (!record) return;
  record->setTimestamp(start);
  for (size_t counter : usage.counters) record->incrementCounter(counter);
}

}  // namespace fbf
