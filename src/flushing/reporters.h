// Which feedback of a session counts as a user engagement, as a typed
// keystroke or as a ranking, and which client surface produced the session.
//
// The reporters are values that own a copy of their feedback message, so a
// list of them stays valid when the session they came from is rewritten.
// Stateless apart from that copy; safe to use from any thread.
#pragma once

#include "corevireon.pb.h"

#include <cstdint>
#include <optional>
#include <set>
#include <string_view>
#include <variant>
#include <vector>

namespace fbf {

// The client surface named by an agent string. Matching is on the lower-cased
// agent and the first rule that matches wins, in this order:
//   contains "wayfin" -> 1 (web browser), "scoutlume" -> 2 (system search UI),
//   "news" -> 4 (news reader), "messages" -> 3 (messaging);
// an absent or empty agent, or none of these, is 0.
corevireon::CVClient cohortsClient(std::optional<std::string_view> agent);
corevireon::CVClient cohortsClient(const corevireon::CVClientSession& session);

// Trigger events that are previews in the system search UI (9, 8, 3); built
// once on first use.
const std::set<int32_t>& triggerEventScoutlumePreviewTypes();

// The reporters are handles, like CVIdentifiable: they point into a message
// owned elsewhere (a session's feedback list) and must not outlive it.
// Counting a session's usage builds one per feedback message, so copying
// each message would cost more than the counting itself.

// Result engagement, did-go-to-site and did-go-to-search feedback.
class EngagementReporter {
 public:
  using Feedback = std::variant<const corevireon::CVResultEngagementFeedback*, const corevireon::CVDidGoToSiteFeedback*,
                                const corevireon::CVDidGoToSearchFeedback*>;

  // A reporter for a message of one of the three kinds; none for anything else.
  static std::optional<EngagementReporter> from(const google::protobuf::Message& feedback);
  static std::optional<EngagementReporter> from(const google::protobuf::Message&& feedback) = delete;
  explicit EngagementReporter(Feedback feedback) : feedback_(std::move(feedback)) {}

  // Result engagement: true for every client but 2; for client 2 only when
  // the trigger event is not a preview and the destination is not 1.
  // Did-go-to-site: client 1 only. Did-go-to-search: clients 1 and 2.
  bool isEngagement(corevireon::CVClient client) const;

  const Feedback& feedback() const { return feedback_; }
  // The engagement as a result engagement, or null for the other kinds.
  const corevireon::CVResultEngagementFeedback* resultEngagement() const;

 private:
  Feedback feedback_;
};

// Local and network search starts.
class KeystrokeReporter {
 public:
  using Feedback =
      std::variant<const corevireon::CVStartLocalSearchFeedback*, const corevireon::CVStartNetworkSearchFeedback*>;

  static std::optional<KeystrokeReporter> from(const google::protobuf::Message& feedback);
  static std::optional<KeystrokeReporter> from(const google::protobuf::Message&& feedback) = delete;
  explicit KeystrokeReporter(Feedback feedback) : feedback_(std::move(feedback)) {}

  // True when `input` is present and non-empty; a network search to
  // endpoint 12 never counts.
  bool isKeystroke() const;

  const Feedback& feedback() const { return feedback_; }

 private:
  Feedback feedback_;
};

// A ranking feedback; its results are those of its section rankings'
// sections (see `containedResults`).
class RankingReporter {
 public:
  static std::optional<RankingReporter> from(const google::protobuf::Message& feedback);
  static std::optional<RankingReporter> from(const google::protobuf::Message&& feedback) = delete;
  explicit RankingReporter(const corevireon::CVRankingFeedback& feedback) : feedback_(&feedback) {}

  std::vector<const corevireon::CVSearchResultForFeedback*> containedResults() const;
  const corevireon::CVRankingFeedback& feedback() const { return *feedback_; }

 private:
  const corevireon::CVRankingFeedback* feedback_;
};

}  // namespace fbf
