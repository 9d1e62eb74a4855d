#include "flushing/url_matching.h"

#include <libpsl.h>
#include <uriparser/Uri.h>

#include <string>
#include <tuple>
#include <unordered_map>
#include <vector>

namespace fbf {

namespace {

const psl_ctx_t* publicSuffixList() {
  // The list compiled into libpsl when it has one, else the system's copy.
  static const psl_ctx_t* const ctx = [] {
    const psl_ctx_t* builtin = psl_builtin();
    return builtin != nullptr ? builtin : static_cast<const psl_ctx_t*>(psl_latest(nullptr));
  }();
  return ctx;
}

std::optional<std::string> textOf(const UriTextRangeA& range) {
  if (range.first == nullptr) return std::nullopt;
  return std::string(range.first, range.afterLast);
}

// Owns the uriparser structure for the length of one parse.
struct ParsedUri {
  UriUriA uri{};
  bool valid = false;
  ~ParsedUri() {
    if (valid) uriFreeUriMembersA(&uri);
  }
};

std::vector<std::string_view> splitPath(std::string_view path) {
  std::vector<std::string_view> segments;
  if (!path.empty() && path.front() == '/') path.remove_prefix(1);
  while (true) {
    size_t slash = path.find('/');
    segments.push_back(path.substr(0, slash));
    if (slash == std::string_view::npos) break;
    path.remove_prefix(slash + 1);
  }
  return segments;
}

bool endsWith(std::string_view s, std::string_view suffix) {
  return s.size() >= suffix.size() && s.substr(s.size() - suffix.size()) == suffix;
}

// Answers of the public suffix list by name, per thread. A flush asks about
// the same few hosts over and over (every shown and visited address of every
// session), and each lookup walks the list; the answers never change, so the
// cache only has to stay small: it starts over when full.
class SuffixListCache {
 public:
  template <typename Lookup>
  std::optional<std::string> get(std::string_view name, Lookup&& lookup) {
    key_.assign(name);
    if (auto it = entries_.find(key_); it != entries_.end()) return it->second;
    if (entries_.size() >= kCapacity) entries_.clear();
    const char* answer = lookup(key_.c_str());
    auto value = answer != nullptr ? std::optional<std::string>(answer) : std::nullopt;
    entries_.emplace(key_, value);
    return value;
  }

 private:
  static constexpr size_t kCapacity = 4096;
  std::string key_;
  std::unordered_map<std::string, std::optional<std::string>> entries_;
};

// The public suffix of a registrable domain, e.g. "co.uk" for "example.co.uk".
std::optional<std::string> publicSuffixOf(const std::string& domain) {
  thread_local SuffixListCache cache;
  return cache.get(domain, [](const char* name) { return psl_unregistrable_domain(publicSuffixList(), name); });
}

}  // namespace

std::optional<MatchURLComponents> parseURLComponents(std::string_view text) {
  std::string owned(text);
  ParsedUri parsed;
  const char* errorPos = nullptr;
  if (uriParseSingleUriExA(&parsed.uri, owned.data(), owned.data() + owned.size(), &errorPos) != URI_SUCCESS) {
    return std::nullopt;
  }
  parsed.valid = true;
  // A normalisation failure (out of memory) leaves the text as written.
  (void)uriNormalizeSyntaxA(&parsed.uri);

  MatchURLComponents c;
  c.scheme = textOf(parsed.uri.scheme);
  c.userInfo = textOf(parsed.uri.userInfo);
  c.host = textOf(parsed.uri.hostText);
  c.port = textOf(parsed.uri.portText);
  c.query = textOf(parsed.uri.query);
  c.fragment = textOf(parsed.uri.fragment);
  c.hostIsIPLiteral = parsed.uri.hostData.ip4 != nullptr || parsed.uri.hostData.ip6 != nullptr ||
                      parsed.uri.hostData.ipFuture.first != nullptr;
  if (c.host && !c.host->empty() && c.host->back() == '.') c.host->pop_back();

  bool first = true;
  for (const UriPathSegmentA* s = parsed.uri.pathHead; s != nullptr; s = s->next) {
    if (!first || c.host.has_value() || parsed.uri.absolutePath == URI_TRUE) c.path += '/';
    first = false;
    c.path.append(s->text.first, s->text.afterLast);
  }
  return c;
}

std::optional<std::string> registrableDomain(std::string_view host) {
  if (host.empty()) return std::nullopt;
  thread_local SuffixListCache cache;
  return cache.get(host, [](const char* name) { return psl_registrable_domain(publicSuffixList(), name); });
}

std::optional<std::string> embeddedAMPURL(const MatchURLComponents& components) {
  if (!components.host || components.hostIsIPLiteral) return std::nullopt;
  const std::string& host = *components.host;
  std::vector<std::string_view> segments = splitPath(components.path);

  size_t next = 0;
  if (endsWith(host, ".cdn.ampproject.org")) {
    if (segments.empty()) return std::nullopt;
    std::string_view kind = segments[0];
    if (kind != "c" && kind != "v" && kind != "i" && kind != "r") return std::nullopt;
    next = 1;
  } else {
    auto domain = registrableDomain(host);
    if (!domain || domain->rfind("google.", 0) != 0) return std::nullopt;
    if (segments.empty() || segments[0] != "amp") return std::nullopt;
    next = 1;
  }

  bool secure = false;
  if (next < segments.size() && segments[next] == "s") {
    secure = true;
    ++next;
  }
  if (next >= segments.size()) return std::nullopt;
  std::string_view embeddedHost = segments[next];
  if (embeddedHost.find('.') == std::string_view::npos) return std::nullopt;

  std::string url = secure ? "https://" : "http://";
  url += embeddedHost;
  for (size_t i = next + 1; i < segments.size(); ++i) {
    url += '/';
    url += segments[i];
  }
  if (components.query) url += "?" + *components.query;
  if (components.fragment) url += "#" + *components.fragment;
  return url;
}

std::optional<MatchURLComponents> componentsForEmbeddedAMPURL(const MatchURLComponents& components) {
  auto embedded = embeddedAMPURL(components);
  if (!embedded) return std::nullopt;
  auto parsed = parseURLComponents(*embedded);
  if (!parsed) return std::nullopt;
  if (auto reduced = componentsAfterRemovingSubdomains(*parsed)) return reduced;
  return parsed;
}

std::optional<MatchURLComponents> componentsAfterRemovingSubdomains(const MatchURLComponents& components) {
  if (!components.host || components.hostIsIPLiteral) return std::nullopt;
  auto domain = registrableDomain(*components.host);
  if (!domain) return std::nullopt;
  MatchURLComponents reduced = components;
  reduced.host = std::move(domain);
  return reduced;
}

std::optional<std::string> normalizedURLStringForTLDFeatures(const MatchURLComponents& components) {
  if (!components.host || components.host->empty()) return std::nullopt;
  const std::string& host = *components.host;
  if (components.hostIsIPLiteral) return host;
  auto domain = registrableDomain(host);
  if (!domain) return host;
  auto suffix = publicSuffixOf(*domain);
  if (!suffix || suffix->size() + 1 >= domain->size()) return *domain;
  return domain->substr(0, domain->size() - suffix->size() - 1);
}

namespace {

MatchURLComponents sanitised(const MatchURLComponents& parsed) {
  if (embeddedAMPURL(parsed)) {
    if (auto embedded = componentsForEmbeddedAMPURL(parsed)) return *embedded;
  } else if (auto reduced = componentsAfterRemovingSubdomains(parsed)) {
    return *reduced;
  }
  return parsed;
}

}  // namespace

std::optional<CBAComparable> cbaComparable(std::string_view url) {
  auto parsed = parseURLComponents(url);
  if (!parsed) return std::nullopt;
  CBAComparable c{sanitised(*parsed), std::nullopt};
  c.address.scheme.reset();
  if (!c.address.path.empty() && c.address.path.back() == '/') c.address.path.pop_back();
  c.site = normalizedURLStringForTLDFeatures(c.address);
  return c;
}

corevireon::CVCBAEngagementType cbaMatchBetween(const CBAComparable& candidate, const CBAComparable& visited) {
  const MatchURLComponents& x = candidate.address;
  const MatchURLComponents& y = visited.address;
  auto allButQuery = [](const MatchURLComponents& c) {
    return std::tie(c.scheme, c.userInfo, c.host, c.port, c.path, c.fragment, c.hostIsIPLiteral);
  };
  if (allButQuery(x) == allButQuery(y)) {
    return x.query == y.query ? corevireon::CV_CBA_ENGAGEMENT_TYPE_SAME_ADDRESS
                              : corevireon::CV_CBA_ENGAGEMENT_TYPE_SAME_ADDRESS_IGNORING_QUERY;
  }
  // The query never reaches the site key: it is made of the host alone.
  if (candidate.site == visited.site) return corevireon::CV_CBA_ENGAGEMENT_TYPE_SAME_SITE;
  return corevireon::CV_CBA_ENGAGEMENT_TYPE_NO_MATCH;
}

corevireon::CVCBAEngagementType cbaMatchBetween(std::optional<std::string_view> candidate,
                                                std::optional<std::string_view> visited) {
  if (!candidate || !visited) return corevireon::CV_CBA_ENGAGEMENT_TYPE_NO_MATCH;
  auto x = cbaComparable(*candidate);
  auto y = cbaComparable(*visited);
  if (!x || !y) return corevireon::CV_CBA_ENGAGEMENT_TYPE_NO_MATCH;
  return cbaMatchBetween(*x, *y);
}

}  // namespace fbf
