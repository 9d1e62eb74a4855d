#include "session_generator.h"

#include "assembly/feedback_types.h"

#include <fcntl.h>
#include <google/protobuf/io/coded_stream.h>
#include <google/protobuf/io/zero_copy_stream_impl_lite.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <cmath>
#include <cstring>
#include <fmt/format.h>

namespace fbf::sessiongen {

using namespace corevireon;

std::optional<SizeMix> sizeMixFromString(std::string_view text) {
  if (text == "small") return SizeMix::small;
  if (text == "realistic") return SizeMix::realistic;
  if (text == "large") return SizeMix::large;
  return std::nullopt;
}

namespace {

constexpr std::array<std::string_view, 9> kAgents = {
    "Wayfin/17.4 (X11; Linux x86_64)", "Scoutlume/17.4", "News/8.1", "Messages/17.0", "NewsMessages/2.0",
    "WAYFIN-Lite/3.2",                 "Mail/16.0",      "",         "<absent>"};

constexpr std::array<std::string_view, 12> kSites = {
    "example",  "wikipedia", "recipes-daily", "citymaps", "openforum", "techreview",
    "weatherly", "bookshelf", "sportsline",    "travelog", "musicbox",  "healthwise"};
constexpr std::array<std::string_view, 6> kSuffixes = {"com", "org", "co.uk", "net", "de", "com.au"};
constexpr std::array<std::string_view, 10> kWords = {"best",   "pasta",  "weather", "near",  "me",
                                                     "how",    "to",     "fix",     "train", "tickets"};
constexpr std::array<std::string_view, 8> kOtherSections = {"vireon.apps",    "vireon.contacts", "vireon.maps",
                                                            "vireon.news",    "vireon.settings", "vireon.mail",
                                                            "vireon.stocks",  "vireon.movies"};
constexpr std::array<std::string_view, 6> kCountries = {"US", "GB", "DE", "FR", "JP", "AU"};
constexpr std::array<std::string_view, 6> kLocales = {"en_US", "en_GB", "de_DE", "fr_FR", "ja_JP", "en_AU"};
// Result types: web-like, the eight title-keeping types, local applications
// (20 is exempt from bundle codes) and a few others.
constexpr std::array<int32_t, 16> kResultTypes = {1, 2, 3, 5, 7, 9, 10, 11, 12, 13, 14, 18, 19, 20, 21, 4};
// Payload event numbers that arrive without a feedback message.
constexpr std::array<int32_t, 10> kMessagelessTypes = {9, 10, 11, 12, 13, 21, 33, 34, 37, 39};

struct SizeShape {
  double median;
  double sigma;
  double cap;
};

SizeShape shapeOf(SizeMix mix) {
  switch (mix) {
    case SizeMix::small: return {4'000, 0.6, 64'000};
    case SizeMix::large: return {400'000, 0.7, 2'000'000};
    case SizeMix::realistic: break;
  }
  return {16'000, 1.0, 2'000'000};
}

}  // namespace

// Builds one session; lives for one call of nextSession.
class SessionBuilder {
 public:
  explicit SessionBuilder(SessionGenerator& g) : g_(g), rng_(g.rng_) {}

  GeneratedSession build();

 private:
  // Random helpers.
  uint64_t below(uint64_t n) { return std::uniform_int_distribution<uint64_t>(0, n - 1)(rng_); }
  int between(int lo, int hi) { return std::uniform_int_distribution<int>(lo, hi)(rng_); }
  bool chance(double p) { return std::bernoulli_distribution(p)(rng_); }
  template <class C>
  const auto& pick(const C& c) {
    return c[below(c.size())];
  }
  std::string hex(uint64_t v, int digits) { return fmt::format("{:0{}x}", v, digits); }

  std::string canary(char kind) {
    return "cnry" + std::string(1, kind) + hex(g_.canaryCounter_++ & 0xffffffffu, 8) + hex(rng_() & 0xffffffffu, 8);
  }
  std::string newIdentifier(std::string_view prefix) {
    if (g_.options_.plantCanaries) {
      std::string c = canary('i');
      out_.canaries.identifiers.push_back(c);
      return c;
    }
    return std::string(prefix) + hex(rng_(), 16);
  }
  std::string words(int n) {
    std::string s;
    for (int i = 0; i < n; ++i) {
      if (i) s += ' ';
      s += pick(kWords);
    }
    return s;
  }

  // Time moves by a few milliseconds to seconds between events; sometimes
  // two events share a timestamp.
  uint64_t tick() {
    if (!chance(0.03)) now_ += static_cast<uint64_t>(between(2, 2500)) * 1'000'000ULL + below(1'000'000);
    return now_;
  }

  CVFeedbackPayload& add(int32_t type) {
    CVFeedbackPayload& p = *session().mutable_feedbacks()->add_items();
    p.set_queryid(queryId_);
    p.set_type(type);
    return p;
  }
  CVClientSession& session() { return out_.session; }

  CVSearchResultForFeedback makeResult(const std::string& section, bool web);
  void buildQuery();
  void addCBA(const std::vector<std::string>& webURLs);
  std::string visitedAddressMatching(const std::string& shown, int level);

  SessionGenerator& g_;
  std::mt19937_64& rng_;
  GeneratedSession out_;
  uint64_t now_ = 0;
  uint64_t queryId_ = 0;
  std::string site_;
};

CVSearchResultForFeedback SessionBuilder::makeResult(const std::string& section, bool web) {
  CVSearchResultForFeedback r;
  r.set_identifier(newIdentifier(web ? "web:" : "loc:"));
  r.set_type(web ? (chance(0.7) ? 1 : 2) : pick(kResultTypes));
  r.set_title(words(between(2, 6)));
  r.set_jsonsectionbundleidentifier(section);
  r.set_score(std::uniform_real_distribution<double>(0, 1)(rng_));
  r.set_knownsectionbundleidentifier(between(0, 120));
  if (section == "vireon.apps") {
    r.set_islocalapplicationresult(true);
    if (chance(0.3)) r.set_type(20);
    r.set_resultbundleid(fmt::format("org.vireon.app{}", between(1, 40)));
  }
  if (chance(0.5)) r.set_userinput(words(between(1, 3)));
  if (chance(0.4)) r.set_completedquery(words(between(2, 4)));
  if (chance(0.2)) r.set_intendedquery(words(between(2, 4)));
  if (web || chance(0.3)) {
    auto* punchout = r.mutable_punchout();
    punchout->set_name(std::string(pick(kSites)));
    if (web) {
      std::string site(pick(kSites));
      std::string suffix(pick(kSuffixes));
      auto* urls = punchout->mutable_urls();
      urls->add_items(fmt::format("https://www.{}.{}/{}/{}", site, suffix, pick(kWords), hex(rng_(), 6)));
      if (chance(0.3)) urls->add_items(fmt::format("https://m.{}.{}/{}", site, suffix, pick(kWords)));
    } else {
      punchout->set_bundleidentifier(fmt::format("org.vireon.app{}", between(1, 40)));
    }
  }
  return r;
}

// A visited address derived from a shown one at a match level: 3 the same
// page (other scheme, other subdomain, trailing "/"), 2 the same page with a
// query, 1 the same site name elsewhere, 0 another site. With canaries the
// planted string sits where it does not change the level (a subdomain label
// or a query value).
std::string SessionBuilder::visitedAddressMatching(const std::string& shown, int level) {
  // shown is https://<sub>.<site>.<suffix>/<path>
  std::string rest = shown.substr(shown.find("://") + 3);
  std::string host = rest.substr(0, rest.find('/'));
  std::string path = rest.substr(host.size());
  std::string domain = host.substr(host.find('.') + 1);  // site.suffix
  std::string site = domain.substr(0, domain.find('.'));
  const bool canaries = g_.options_.plantCanaries;
  std::string label = canaries ? canary('u') : std::string(chance(0.5) ? "m" : "amp");
  if (canaries) out_.canaries.visitedAddresses.push_back(label);
  switch (level) {
    case 3:
      if (chance(0.25)) {
        // The same page through an AMP cache.
        return fmt::format("https://{}.cdn.ampproject.org/c/s/{}{}", label, host, path);
      }
      return fmt::format("http://{}.{}{}/", label, domain, path);
    case 2:
      if (canaries) return fmt::format("https://{}{}?ref={}", domain, path, label);
      return fmt::format("https://{}.{}{}?utm_source=search&id={}", label, domain, path, below(1000));
    case 1:
      return fmt::format("https://{}.{}.{}/{}", label, site, domain.ends_with(".org") ? "net" : "org", pick(kWords));
    default:
      return fmt::format("https://{}.unrelated-{}.example/{}", label, hex(rng_(), 4), pick(kWords));
  }
}

void SessionBuilder::addCBA(const std::vector<std::string>& webURLs) {
  auto& cba = *add(CV_FEEDBACK_EVENT_TYPE_CBA_ENGAGEMENT).mutable_cbaengagement();
  cba.set_timestamp(tick());
  if (chance(0.05)) return;  // no address recorded: always dropped
  if (webURLs.empty()) {
    cba.set_url(visitedAddressMatching("https://www.elsewhere.com/x", 0));
    return;
  }
  const int level = static_cast<int>(below(4));
  cba.set_url(visitedAddressMatching(pick(webURLs), level));
}

void SessionBuilder::buildQuery() {
  queryId_ = rng_() | (1ULL << 62);  // large ids: the JSON must keep all 64 bits
  const std::string input = words(between(1, 4));

  if (chance(0.1)) add(pick(kMessagelessTypes));  // card events carry no message

  {
    auto& m = *add(CV_FEEDBACK_EVENT_TYPE_LOCAL_SEARCH_START).mutable_startlocalsearch();
    m.set_timestamp(tick());
    if (!chance(0.1)) m.set_input(chance(0.1) ? std::string() : input);
  }
  {
    auto& m = *add(CV_FEEDBACK_EVENT_TYPE_NETWORK_SEARCH_START).mutable_startnetworksearch();
    m.set_timestamp(tick());
    m.set_input(input);
    m.set_endpoint(chance(0.2) ? 12 : between(1, 4));
  }

  // Suggestions: shown ones are delivered in full; an engagement may name one
  // that was never shown (it becomes a missing suggestion).
  std::vector<CVSearchSuggestionForFeedback> suggestions;
  {
    auto& m = *add(CV_FEEDBACK_EVENT_TYPE_VISIBLE_SUGGESTIONS).mutable_visiblesuggestions();
    m.set_timestamp(tick());
    for (int i = 0, n = between(2, 8); i < n; ++i) {
      auto& s = *m.add_suggestions();
      s.set_identifier(newIdentifier("sug:"));
      s.set_type(between(1, 6));
      s.set_suggestion(input + " " + words(1));
      s.set_score(std::uniform_real_distribution<double>(0, 1)(rng_));
      suggestions.push_back(s);
    }
  }
  if (chance(0.4)) {
    auto& m = *add(CV_FEEDBACK_EVENT_TYPE_SUGGESTION_ENGAGEMENT).mutable_suggestionengagement();
    m.set_timestamp(tick());
    m.set_triggerevent(static_cast<CVTriggerEngagementEvent>(between(0, 9)));
    if (chance(0.8)) {
      *m.mutable_suggestion() = pick(suggestions);
    } else {
      auto& s = *m.mutable_suggestion();
      s.set_identifier(newIdentifier("sug:"));
      s.set_type(between(1, 6));
      s.set_suggestion(input);
    }
  }

  {
    auto& m = *add(CV_FEEDBACK_EVENT_TYPE_LOCAL_SEARCH_END).mutable_endlocalsearch();
    m.set_timestamp(tick());
    m.set_resultcount(static_cast<uint32_t>(between(0, 40)));
  }
  {
    auto& m = *add(CV_FEEDBACK_EVENT_TYPE_NETWORK_SEARCH_END).mutable_endnetworksearch();
    m.set_timestamp(tick());
    m.set_endpoint(between(1, 4));
    m.set_statuscode(chance(0.95) ? 200 : 503);
    m.set_responsesize(below(200'000));
  }

  // Sections and their results.
  struct Section {
    std::string bundle;
    std::vector<CVSearchResultForFeedback> results;
  };
  std::vector<Section> sections;
  const int sectionCount = between(2, 6);
  for (int i = 0; i < sectionCount; ++i) {
    Section s;
    const bool web = i == 0 ? chance(0.85) : chance(0.25);
    s.bundle = web ? (chance(0.7) ? "vireon.web_index" : "vireon.web_suggest") : std::string(pick(kOtherSections));
    for (int k = 0, n = between(2, 10); k < n; ++k) s.results.push_back(makeResult(s.bundle, web));
    sections.push_back(std::move(s));
  }

  // The ranking: every section ranking with the rankings of its results.
  {
    auto& m = *add(chance(0.5) ? CV_FEEDBACK_EVENT_TYPE_RANK_SECTIONS : CV_FEEDBACK_EVENT_TYPE_RANK_SECTIONS_ALT)
                   .mutable_ranking();
    m.set_timestamp(tick());
    for (size_t i = 0; i < sections.size(); ++i) {
      auto& sr = *m.add_sections();
      sr.set_timestamp(0);
      sr.set_position(static_cast<uint32_t>(i));
      auto& section = *sr.mutable_section();
      section.set_bundleidentifier(sections[i].bundle);
      section.set_title(words(2));
      auto* results = section.mutable_results();
      const bool withRankings = chance(0.7);
      for (size_t k = 0; k < sections[i].results.size(); ++k) {
        *results->add_items() = sections[i].results[k];
        if (!withRankings) continue;
        auto& rr = *sr.add_results();
        rr.set_localposition(static_cast<uint32_t>(k));
        *rr.mutable_result() = sections[i].results[k];
        if (chance(0.1)) *rr.add_duplicateresults() = makeResult(sections[i].bundle, false);
        if (chance(0.1)) *rr.add_hiddenresults() = makeResult(sections[i].bundle, false);
      }
    }
  }

  // What the user saw: the first sections, sometimes a result that the
  // session never delivered in full.
  std::vector<CVSearchResultForFeedback> shown;
  std::vector<std::string> webURLs;
  {
    // Sometimes the visit is recorded before the results were reported; it
    // can then match nothing.
    if (chance(0.05)) addCBA({});
    auto& m = *add(CV_FEEDBACK_EVENT_TYPE_VISIBLE_RESULTS).mutable_visibleresults();
    m.set_timestamp(tick());
    for (size_t i = 0; i < sections.size() && i < 3; ++i) {
      for (const auto& r : sections[i].results) {
        *m.add_results() = r;
        shown.push_back(r);
        if (r.has_punchout() && r.punchout().has_urls() &&
            (r.jsonsectionbundleidentifier() == "vireon.web_index" ||
             r.jsonsectionbundleidentifier() == "vireon.web_suggest")) {
          for (const auto& u : r.punchout().urls().items()) webURLs.push_back(u);
        }
      }
    }
    if (chance(0.2)) {
      auto r = makeResult(std::string(pick(kOtherSections)), false);
      *m.add_results() = r;
      shown.push_back(r);
    }
  }
  if (chance(0.15)) {
    auto& m = *add(CV_FEEDBACK_EVENT_TYPE_VISIBLE_SECTION_HEADER).mutable_visiblesectionheader();
    m.set_timestamp(tick());
    m.mutable_section()->set_bundleidentifier(sections.back().bundle);
    m.mutable_section()->set_title(words(2));
  }
  if (chance(0.1)) {
    auto& m = *add(CV_FEEDBACK_EVENT_TYPE_RESULTS_RECEIVED_AFTER_TIMEOUT).mutable_resultsreceivedaftertimeout();
    m.set_timestamp(tick());
    for (int i = 0, n = between(1, 4); i < n; ++i) *m.add_results() = makeResult("vireon.web_index", true);
  }
  if (chance(0.1)) {
    auto& m = *add(CV_FEEDBACK_EVENT_TYPE_LATE_SECTIONS_APPENDED).mutable_latesectionsappended();
    m.set_timestamp(tick());
    auto& section = *m.add_sections();
    section.set_bundleidentifier(std::string(pick(kOtherSections)));
    for (int i = 0, n = between(1, 5); i < n; ++i) {
      *section.mutable_results()->add_items() = makeResult(section.bundleidentifier(), false);
    }
  }

  // Engagements of every kind.
  for (int i = 0, n = between(0, 3); i < n && !shown.empty(); ++i) {
    auto& m = *add(CV_FEEDBACK_EVENT_TYPE_RESULT_ENGAGEMENT).mutable_resultengagement();
    m.set_timestamp(tick());
    *m.mutable_result() = pick(shown);
    std::string title = m.result().title();
    if (g_.options_.plantCanaries) {
      std::string c = canary('t');
      out_.canaries.titles.push_back(c);
      title += " " + c;
    }
    m.set_titletext(title);
    m.set_matchesunengagedsuggestion(chance(0.3));
    m.set_triggerevent(static_cast<CVTriggerEngagementEvent>(between(0, 9)));
    m.set_destination(between(0, 3));
  }
  if (chance(0.2) && !shown.empty()) {
    auto& m = *add(CV_FEEDBACK_EVENT_TYPE_RESULT_GRADE).mutable_resultgrading();
    m.set_timestamp(tick());
    *m.mutable_result() = pick(shown);
    m.set_grade(between(0, 4));
  }
  if (chance(0.2)) {
    auto& m = *add(CV_FEEDBACK_EVENT_TYPE_SECTION_ENGAGEMENT).mutable_sectionengagement();
    m.set_timestamp(tick());
    const auto& s = pick(sections);
    m.mutable_section()->set_bundleidentifier(s.bundle);
    for (const auto& r : s.results) *m.mutable_section()->mutable_results()->add_items() = r;
    m.set_triggerevent(chance(0.4) ? CV_TRIGGER_ENGAGEMENT_EVENT_EXPAND : CV_TRIGGER_ENGAGEMENT_EVENT_TAP);
  }
  for (int i = 0, n = between(0, 3); i < n; ++i) addCBA(webURLs);
  if (chance(0.3)) {
    auto& m = *add(CV_FEEDBACK_EVENT_TYPE_DID_GO_TO_SITE).mutable_didgotosite();
    m.set_timestamp(tick());
    m.set_triggerevent(static_cast<CVTriggerEngagementEvent>(between(0, 9)));
  }
  if (chance(0.3)) {
    auto& m = *add(CV_FEEDBACK_EVENT_TYPE_DID_GO_TO_SEARCH).mutable_didgotosearch();
    m.set_timestamp(tick());
    m.set_triggerevent(static_cast<CVTriggerEngagementEvent>(between(0, 9)));
  }

  // Odds and ends.
  if (chance(0.3)) {
    auto& m = *add(CV_FEEDBACK_EVENT_TYPE_CLIENT_TIMING).mutable_clienttiming();
    m.set_timestamp(tick());
    m.set_name(chance(0.5) ? "render" : "firstResult");
    m.set_durationms(below(2000));
  }
  if (chance(0.05)) {
    auto& m = *add(CV_FEEDBACK_EVENT_TYPE_ERROR).mutable_error();
    m.set_timestamp(tick());
    m.set_domain("vireon.network");
    m.set_code(-between(1, 1100));
  }
  if (chance(0.1)) add(CV_FEEDBACK_EVENT_TYPE_CLEAR_INPUT).mutable_clearinput()->set_timestamp(tick());
  if (chance(0.15)) {
    static constexpr std::array<int32_t, 4> kCustomTypes = {19, 100, 101, 102};
    auto& m = *add(pick(kCustomTypes)).mutable_custom();
    m.set_timestamp(tick());
    switch (below(6)) {
      case 0: break;  // no JSON: left out of the JSON upload
      case 1: m.set_feedbackjson("[1, 2, 3]"); break;
      case 2: m.set_feedbackjson("{not json"); break;
      default:
        m.set_feedbackjson(fmt::format(R"({{"kind":"{}","count":{},"ok":true}})", pick(kWords), below(100)));
    }
  }
}

GeneratedSession SessionBuilder::build() {
  const SizeShape shape = shapeOf(g_.options_.sizeMix);
  double target = std::lognormal_distribution<double>(std::log(shape.median), shape.sigma)(rng_);
  // A few very long sessions make the realistic tail, up to the size limit.
  if (g_.options_.sizeMix == SizeMix::realistic && chance(0.03)) {
    target = std::exp(std::uniform_real_distribution<double>(std::log(200'000.0), std::log(shape.cap))(rng_));
  }
  target = std::min(shape.cap, target);

  CVClientSession& s = session();
  const std::string_view agent = pick(kAgents);
  if (agent != "<absent>") s.set_agent(std::string(agent));
  s.set_userguidstring(g_.nextUUID());
  const size_t country = below(kCountries.size());
  s.set_countrycode(std::string(kCountries[country]));
  s.set_locale(std::string(kLocales[country]));
  (*s.mutable_resourceversions())["ranker"] = fmt::format("{}.{}", between(1, 9), between(0, 30));
  (*s.mutable_resourceversions())["spelling"] = fmt::format("{}", between(100, 999));
  if (chance(0.5)) (*s.mutable_resourceversions())["entities"] = fmt::format("2024.{}", between(1, 12));
  s.set_removetimestamps(chance(0.1));
  const double spread = std::max(1, g_.options_.days) * 86400.0;
  s.set_sessionstart(g_.options_.now - std::uniform_real_distribution<double>(0, spread)(rng_));
  s.set_previoussessionendreason(static_cast<CVSessionEndReason>(between(0, 8)));
  s.set_duenabled(chance(0.8));
  s.set_firstuse(chance(0.05));
  if (chance(0.5)) s.mutable_usagesincelookback()->set_activedaysincollectionperiod(static_cast<uint32_t>(between(0, 28)));
  if (chance(0.3)) {
    auto& c = *s.mutable_cohortsfeedback();
    switch (between(1, 6)) {
      case 1: c.mutable_usageenvelope()->set_client(CV_CLIENT_WEB_BROWSER); break;
      case 2: c.mutable_scoutlumeusagepropensity()->set_totalengagements(between(0, 200)); break;
      case 3: c.mutable_wayfinusagepropensity()->set_gotosite("0.25"); break;
      case 4: c.mutable_newsusagepropensity()->set_totalengagements(0); break;
      case 5: c.mutable_imagesusagepropensity()->set_image("0.5"); break;
      default: c.mutable_propensityenvelope()->set_configuredlookbacktimeindays(28); break;
    }
  }

  now_ = 1'000'000'000'000ULL + below(400'000'000'000'000ULL);  // uptime: 17 minutes to 4.6 days
  s.mutable_feedbacks();
  {
    auto& m = *add(CV_FEEDBACK_EVENT_TYPE_SEARCH_VIEW_APPEAR).mutable_searchviewappear();
    m.set_timestamp(tick());
    m.set_triggerevent(static_cast<CVTriggerEngagementEvent>(between(0, 9)));
  }
  // Sizes are summed per payload: recomputing the whole session after every
  // query would be quadratic in the large sessions.
  double size = static_cast<double>(s.ByteSizeLong());
  do {
    const int before = s.feedbacks().items_size();
    buildQuery();
    for (int i = before; i < s.feedbacks().items_size(); ++i) {
      size += static_cast<double>(s.feedbacks().items(i).ByteSizeLong()) + 4;
    }
  } while (size < target);
  queryId_ = 0;
  {
    auto& m = *add(CV_FEEDBACK_EVENT_TYPE_SEARCH_VIEW_DISAPPEAR).mutable_searchviewdisappear();
    m.set_timestamp(tick());
  }
  {
    auto& m = *add(CV_FEEDBACK_EVENT_TYPE_SESSION_END).mutable_sessionend();
    m.set_timestamp(tick());
    m.set_reason(static_cast<CVSessionEndReason>(between(1, 7)));
  }
  // Feedback reported late lands out of timestamp order in the file.
  auto* items = s.mutable_feedbacks()->mutable_items();
  // The first payload (the view appearing) stays first.
  for (int i = 0, swaps = between(0, 3); i < swaps && items->size() > 3; ++i) {
    const int k = 1 + static_cast<int>(below(static_cast<uint64_t>(items->size() - 2)));
    items->SwapElements(k, k + 1);
  }
  return std::move(out_);
}

SessionGenerator::SessionGenerator(GeneratorOptions options) : rng_(options.seed), options_(options) {}

GeneratedSession SessionGenerator::nextSession() { return SessionBuilder(*this).build(); }

std::string SessionGenerator::nextUUID() {
  const uint64_t hi = (rng_() & 0xFFFFFFFFFFFF0FFFULL) | 0x0000000000004000ULL;
  const uint64_t lo = (rng_() & 0x3FFFFFFFFFFFFFFFULL) | 0x8000000000000000ULL;
  return fmt::format("{:08X}-{:04X}-{:04X}-{:04X}-{:012X}", hi >> 32, (hi >> 16) & 0xFFFF, hi & 0xFFFF, lo >> 48,
                     lo & 0xFFFFFFFFFFFFULL);
}

CustomFeedbackFile SessionGenerator::nextCustomFeedback() {
  const auto& types = allCustomFeedbackDirectories();
  CustomFeedbackFile f;
  f.typeName = types[customCounter_++ % types.size()];
  f.fileName = nextUUID();
  if (f.typeName == "Usage") {
    CVCohortsFeedback c;
    if (rng_() % 2 == 0) {
      auto& e = *c.mutable_usageenvelope();
      e.set_client(static_cast<CVClient>(1 + rng_() % 4));
      e.set_collectionstarttimestamp(static_cast<int64_t>(options_.now) - 86400);
      e.set_collectionendtimestamp(static_cast<int64_t>(options_.now));
      e.mutable_usagesincelookback()->set_activedaysincollectionperiod(static_cast<uint32_t>(rng_() % 28));
      e.set_uuid(std::string(16, static_cast<char>(rng_() & 0x7f)));
    } else {
      auto& e = *c.mutable_propensityenvelope();
      e.set_configuredlookbacktimeindays(28);
      e.mutable_wayfinusagepropensity()->set_gotosite("0.5");
      e.mutable_wayfinusagepropensity()->set_totalengagements(static_cast<int32_t>(rng_() % 50));
    }
    f.contents = serializeDeterministically(c);
  } else {
    std::string records;
    for (uint64_t i = 0, n = 1 + rng_() % 40; i < n; ++i) {
      if (i) records += ',';
      records += fmt::format(R"({{"id":{},"value":"{:016x}","weight":{}}})", i, rng_(), rng_() % 1000);
    }
    f.contents = fmt::format(R"({{"type":"{}","records":[{}]}})", f.typeName, records);
  }
  return f;
}

std::string serializeDeterministically(const google::protobuf::Message& message) {
  std::string bytes;
  {
    google::protobuf::io::StringOutputStream stream(&bytes);
    google::protobuf::io::CodedOutputStream coded(&stream);
    coded.SetSerializationDeterministic(true);
    message.SerializeToCodedStream(&coded);
  }
  return bytes;
}

namespace {

bool makeOwnerOnlyDirectory(const std::filesystem::path& dir, std::string* error) {
  if (::mkdir(dir.c_str(), 0700) != 0 && errno != EEXIST) {
    if (error) *error = fmt::format("cannot create {}: {}", dir.string(), std::strerror(errno));
    return false;
  }
  struct stat st {};
  if (::lstat(dir.c_str(), &st) != 0 || !S_ISDIR(st.st_mode)) {
    if (error) *error = fmt::format("{} is not a directory", dir.string());
    return false;
  }
  if (st.st_uid == ::geteuid() && (st.st_mode & 0777) != 0700) ::chmod(dir.c_str(), 0700);
  return true;
}

bool pathExists(const std::filesystem::path& path) {
  struct stat st {};
  return ::lstat(path.c_str(), &st) == 0;
}

bool writeOwnerOnlyFile(const std::filesystem::path& path, std::string_view contents, std::string* error) {
  const int fd = ::open(path.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC, 0600);
  if (fd < 0) {
    if (error) *error = fmt::format("cannot create {}: {}", path.string(), std::strerror(errno));
    return false;
  }
  size_t written = 0;
  while (written < contents.size()) {
    const ssize_t n = ::write(fd, contents.data() + written, contents.size() - written);
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) {
      if (error) *error = fmt::format("cannot write {}: {}", path.string(), std::strerror(errno));
      ::close(fd);
      return false;
    }
    written += static_cast<size_t>(n);
  }
  ::fchmod(fd, 0600);
  ::close(fd);
  return true;
}

}  // namespace

std::optional<WriteSummary> writeCacheDirectory(const std::filesystem::path& cacheDir, int sessions, int customFiles,
                                                SessionGenerator& generator, std::string* error) {
  WriteSummary summary;
  if (!makeOwnerOnlyDirectory(cacheDir, error)) return std::nullopt;
  const int pid = static_cast<int>(::getpid());
  for (int i = 0; i < sessions; ++i) {
    GeneratedSession g = generator.nextSession();
    const std::string bytes = serializeDeterministically(g.session);
    auto path = cacheDir / fmt::format("session.{}.{}.closed", pid, generator.nextUUID());
    // A rerun with the same seed into the same directory draws new names.
    while (pathExists(path)) path = cacheDir / fmt::format("session.{}.{}.closed", pid, generator.nextUUID());
    if (!writeOwnerOnlyFile(path, bytes, error)) return std::nullopt;
    summary.sessionFiles.push_back(path);
    summary.sessionSizes.push_back(bytes.size());
    for (auto* list : {&g.canaries.identifiers, &g.canaries.visitedAddresses, &g.canaries.titles}) {
      summary.canaries.insert(summary.canaries.end(), list->begin(), list->end());
    }
  }
  if (customFiles > 0) {
    const auto customDir = cacheDir / "CustomFeedback";
    if (!makeOwnerOnlyDirectory(customDir, error)) return std::nullopt;
    for (int i = 0; i < customFiles; ++i) {
      CustomFeedbackFile f = generator.nextCustomFeedback();
      const auto dir = customDir / f.typeName;
      if (!makeOwnerOnlyDirectory(dir, error)) return std::nullopt;
      auto path = dir / f.fileName;
      while (pathExists(path)) path = dir / generator.nextUUID();
      if (!writeOwnerOnlyFile(path, f.contents, error)) return std::nullopt;
      summary.customFeedbackFiles.push_back(path);
    }
  }
  return summary;
}

}  // namespace fbf::sessiongen
