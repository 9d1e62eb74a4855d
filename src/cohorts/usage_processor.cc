#include "cohorts/usage_processor.h"

#include <algorithm>
#include <cctype>
#include <functional>
#include <map>
#include <string>

namespace fbf {
namespace usage {

corevireon::CVClient cohortsClient(std::optional<std::string_view> agent) {
  if (!agent || agent->empty()) return corevireon::CV_CLIENT_NONE;
  std::string lower(*agent);
  std::transform(lower.begin(), lower.end(), lower.begin(), [](unsigned char c) { return std::tolower(c); });
  if (lower.find("wayfin") != std::string::npos) return corevireon::CV_CLIENT_WEB_BROWSER;
  if (lower.find("scoutlume") != std::string::npos) return corevireon::CV_CLIENT_SYSTEM_SEARCH_UI;
  if (lower.find("news") != std::string::npos) return corevireon::CV_CLIENT_NEWS;
  if (lower.find("messages") != std::string::npos) return corevireon::CV_CLIENT_MESSAGING;
  return corevireon::CV_CLIENT_NONE;
}

corevireon::CVClient cohortsClient(const corevireon::CVClientSession& session) {
  if (!session.has_agent()) return corevireon::CV_CLIENT_NONE;
  return cohortsClient(std::string_view(session.agent()));
}

}  // namespace usage

namespace {

using corevireon::CVClient;
using corevireon::CVFeedbackPayload;
using corevireon::CVSearchResultForFeedback;

bool isScoutlumePreview(int32_t triggerEvent) { return triggerEvent == 3 || triggerEvent == 8 || triggerEvent == 9; }

bool isEngagement(const CVFeedbackPayload& p, CVClient client) {
  switch (p.codable_case()) {
    case CVFeedbackPayload::kResultEngagement:
      if (client != corevireon::CV_CLIENT_SYSTEM_SEARCH_UI) return true;
      return !isScoutlumePreview(p.resultengagement().triggerevent()) && p.resultengagement().destination() != 1;
    case CVFeedbackPayload::kDidGoToSite:
      return client == corevireon::CV_CLIENT_WEB_BROWSER;
    case CVFeedbackPayload::kDidGoToSearch:
      return client == corevireon::CV_CLIENT_WEB_BROWSER || client == corevireon::CV_CLIENT_SYSTEM_SEARCH_UI;
    default:
      return false;
  }
}

bool isSearch(const CVFeedbackPayload& p) {
  switch (p.codable_case()) {
    case CVFeedbackPayload::kStartLocalSearch:
      return p.startlocalsearch().has_input() && !p.startlocalsearch().input().empty();
    case CVFeedbackPayload::kStartNetworkSearch:
      if (p.startnetworksearch().endpoint() == 12) return false;
      return p.startnetworksearch().has_input() && !p.startnetworksearch().input().empty();
    default:
      return false;
  }
}

// Every result a feedback message carries, as the session's result index
// sees them.
void forEachContainedResult(const CVFeedbackPayload& p, const std::function<void(const CVSearchResultForFeedback&)>& f) {
  auto sectionResults = [&](const corevireon::CVResultSection& section) {
    if (section.has_results()) {
      for (const auto& r : section.results().items()) f(r);
    }
  };
  switch (p.codable_case()) {
    case CVFeedbackPayload::kVisibleResults:
      for (const auto& r : p.visibleresults().results()) f(r);
      break;
    case CVFeedbackPayload::kResultsReceivedAfterTimeout:
      for (const auto& r : p.resultsreceivedaftertimeout().results()) f(r);
      break;
    case CVFeedbackPayload::kSectionRanking:
      sectionResults(p.sectionranking().section());
      break;
    case CVFeedbackPayload::kResultRanking:
      for (const auto& r : p.resultranking().duplicateresults()) f(r);
      for (const auto& r : p.resultranking().hiddenresults()) f(r);
      if (p.resultranking().has_result()) f(p.resultranking().result());
      break;
    case CVFeedbackPayload::kRanking:
      for (const auto& s : p.ranking().sections()) sectionResults(s.section());
      break;
    case CVFeedbackPayload::kResultEngagement:
      if (p.resultengagement().has_result()) f(p.resultengagement().result());
      break;
    case CVFeedbackPayload::kResultGrading:
      if (p.resultgrading().has_result()) f(p.resultgrading().result());
      break;
    case CVFeedbackPayload::kLateSectionsAppended:
      for (const auto& s : p.latesectionsappended().sections()) sectionResults(s);
      break;
    case CVFeedbackPayload::kSectionEngagement:
      sectionResults(p.sectionengagement().section());
      break;
    default:
      break;
  }
}

bool isQuerySuggestion(const CVSearchResultForFeedback& r) {
  const auto& ids = usage::kQuerySuggestionResultBundleIds;
  return std::find(std::begin(ids), std::end(ids), r.knownresultbundleid()) != std::end(ids);
}

bool inRange(int32_t v, int32_t first, int32_t last) { return first <= v && v <= last; }

size_t scoutlumeCounter(const CVFeedbackPayload& p) {
  using C = VIRScoutlumeSession;
  if (p.codable_case() == CVFeedbackPayload::kDidGoToSearch) return C::vireon;
  if (p.codable_case() != CVFeedbackPayload::kResultEngagement || !p.resultengagement().has_result()) return C::other;
  const auto& r = p.resultengagement().result();
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

size_t wayfinCounter(const CVFeedbackPayload& p) {
  using C = VIRWayfinSession;
  if (p.codable_case() == CVFeedbackPayload::kDidGoToSite) return C::goToSite;
  if (p.codable_case() == CVFeedbackPayload::kDidGoToSearch) return C::thirdPartyGoto;
  if (p.codable_case() != CVFeedbackPayload::kResultEngagement || !p.resultengagement().has_result()) return C::other;
  const auto& engagement = p.resultengagement();
  const auto& r = engagement.result();
  int32_t section = r.knownsectionbundleidentifier();
  bool viaReturnKey = engagement.triggerevent() == corevireon::CV_TRIGGER_ENGAGEMENT_EVENT_RETURN_KEY;
  if (isQuerySuggestion(r)) return C::thirdPartyCompletionOrRecentSearch;
  if (r.islocalapplicationresult() || inRange(section, usage::kSectionBrowserLocalFirst, usage::kSectionBrowserLocalLast)) {
    return viaReturnKey ? C::localGoto : C::localTap;
  }
  if (section == usage::kSectionVireonServer) return viaReturnKey ? C::vireonGoto : C::vireonTap;
  if (section == usage::kSectionThirdPartySearch) return viaReturnKey ? C::thirdPartyGoto : C::thirdPartyTap;
  return C::other;
}

size_t imagesCounter(const CVFeedbackPayload& p, const std::map<std::string, const CVSearchResultForFeedback*>& results) {
  using C = VIRImagesSession;
  if (p.codable_case() != CVFeedbackPayload::kResultEngagement || !p.resultengagement().has_result()) return C::other;
  const auto& engaged = p.resultengagement().result();
  if (!engaged.has_identifier()) return C::other;
  auto it = results.find(engaged.identifier());
  if (it == results.end()) return C::other;
  if (isQuerySuggestion(*it->second)) return C::querySuggestion;
  if (it->second->knownsectionbundleidentifier() == usage::kSectionZeroKeyword) return C::zkw;
  return C::image;
}

}  // namespace

bool UsageProcessor::session(bool withSearches, bool engagements, CVClient countsAsUsageFor) {
  if (!engagements) return false;
  if (countsAsUsageFor == corevireon::CV_CLIENT_MESSAGING) return true;
  return withSearches && countsAsUsageFor != corevireon::CV_CLIENT_NONE;
}

void UsageProcessor::reportUsageEvents(const corevireon::CVClientSession& session) {
  auto& context = persistentStore_.managedObjectContext();
  context.performAndWait([&] {
    process(session);
    context.reset();
  });
}

void UsageProcessor::process(const corevireon::CVClientSession& session) {
  auto& context = persistentStore_.managedObjectContext();
  CVClient client = usage::cohortsClient(session);
  if (client != corevireon::CV_CLIENT_NONE) {
    bool searches = false;
    std::vector<const CVFeedbackPayload*> engagements;
    if (session.has_feedbacks()) {
      for (const auto& p : session.feedbacks().items()) {
        if (isSearch(p)) searches = true;
        if (isEngagement(p, client)) engagements.push_back(&p);
      }
    }
    if (UsageProcessor::session(searches, !engagements.empty(), client)) {
      stageSessionSentinel(session, client);
      stageSessionPropensity(session, client, engagements);
    }
  }
  saveOrLogError(context);
}

void UsageProcessor::stageSessionSentinel(const corevireon::CVClientSession& session, CVClient client) {
  auto event = persistentStore_.eventFactory().createUsageEvent();
  if (!event) return;
  event->setTimestamp(timeFromSeconds(session.sessionstart()));
  if (auto category = event->usageCategory()) category->setClientIntVal(client);
}

void UsageProcessor::stageSessionPropensity(const corevireon::CVClientSession& session, CVClient client,
                                            const std::vector<const CVFeedbackPayload*>& engagements) {
  auto& factory = persistentStore_.eventFactory();
  SystemTime start = timeFromSeconds(session.sessionstart());
  switch (client) {
    case corevireon::CV_CLIENT_WEB_BROWSER: {
      auto record = factory.createWayfinSession();
      if (!record) return;
      record->setTimestamp(start);
      for (const auto* p : engagements) record->incrementCounter(wayfinCounter(*p));
      break;
    }
    case corevireon::CV_CLIENT_SYSTEM_SEARCH_UI: {
      auto record = factory.createScoutlumeSession();
      if (!record) return;
      record->setTimestamp(start);
      for (const auto* p : engagements) record->incrementCounter(scoutlumeCounter(*p));
      break;
    }
    case corevireon::CV_CLIENT_MESSAGING: {
      auto record = factory.createEntity<VIRImagesSession>();
      if (!record) return;
      record->setTimestamp(start);
      std::map<std::string, const CVSearchResultForFeedback*> resultsById;
      for (const auto& p : session.feedbacks().items()) {
        forEachContainedResult(p, [&](const CVSearchResultForFeedback& r) {
          if (r.has_identifier()) resultsById[r.identifier()] = &r;
        });
      }
      for (const auto* p : engagements) record->incrementCounter(imagesCounter(*p, resultsById));
      break;
    }
    default:
      // News and anything else: a sentinel only.
      break;
  }
}

}  // namespace fbf
