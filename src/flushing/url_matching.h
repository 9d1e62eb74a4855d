// Address comparison for engaged-visit records: RFC 3986 parsing (uriparser,
// with its syntax normalisation: lower-case scheme and host, upper-case
// percent-encodings, decoded unreserved characters, dot segments removed),
// detection of addresses embedded in AMP cache and AMP viewer addresses,
// reduction of a host to its registrable domain through the public suffix
// list (libpsl), and the site string used for top-level-domain features.
//
// Rules chosen here:
//   * Embedded AMP addresses. An AMP cache address has a host ending in
//     ".cdn.ampproject.org" and a path "/c/", "/v/", "/i/" or "/r/",
//     optionally followed by "s/" (the embedded address is https; without it,
//     http), then the embedded host and the rest of its path:
//       https://www-example-com.cdn.ampproject.org/c/s/www.example.com/a?b
//       embeds https://www.example.com/a?b
//     An AMP viewer address has a host whose registrable domain is
//     "google.<public suffix>" and a path "/amp/", optionally followed by
//     "s/", then the embedded host and path:
//       https://www.google.com/amp/s/example.com/a embeds https://example.com/a
//     The embedded host must contain a "."; the outer query and fragment
//     belong to the embedded address.
//   * Subdomain removal keeps the registrable domain (public suffix plus one
//     label, private suffixes of the list included): www.news.example.co.uk
//     becomes example.co.uk. Hosts that have none (IP literals, single
//     labels such as "localhost", a bare public suffix) are not reduced.
//   * The site string for top-level-domain features is the registrable domain
//     without its public suffix ("www.example.co.uk" and "example.com" both
//     give "example"); a host without a registrable domain gives the host
//     itself; an address without a host gives none.
// Stateless apart from a small per-thread cache of public suffix list
// answers by host; callable from any thread.
#pragma once

#include "corevireon.pb.h"

#include <optional>
#include <string>
#include <string_view>

namespace fbf {

// The parts of one parsed address. The path is the decoded-form text as
// written, "/"-separated, with its leading "/" when it has one.
struct MatchURLComponents {
  std::optional<std::string> scheme;
  std::optional<std::string> userInfo;
  std::optional<std::string> host;
  std::optional<std::string> port;
  std::string path;
  std::optional<std::string> query;
  std::optional<std::string> fragment;
  bool hostIsIPLiteral = false;

  bool operator==(const MatchURLComponents&) const = default;
};

// Parses an RFC 3986 URI reference (relative references included) and
// normalises its syntax; none when the text is not a URI reference.
std::optional<MatchURLComponents> parseURLComponents(std::string_view text);

// The address embedded in an AMP cache or viewer address, as text; none when
// `components` is not such an address.
std::optional<std::string> embeddedAMPURL(const MatchURLComponents& components);

// The embedded AMP address, parsed and reduced to its registrable domain;
// none when there is no embedded address or it does not parse.
std::optional<MatchURLComponents> componentsForEmbeddedAMPURL(const MatchURLComponents& components);

// The components with the host reduced to its registrable domain; none when
// there is no host or the host has no registrable domain.
std::optional<MatchURLComponents> componentsAfterRemovingSubdomains(const MatchURLComponents& components);

// The site string for top-level-domain features (see above).
std::optional<std::string> normalizedURLStringForTLDFeatures(const MatchURLComponents& components);

// The registrable domain of a lower-case host name, if it has one.
std::optional<std::string> registrableDomain(std::string_view host);

// How well a visited address matches a shown one: 3 the same address, 2 the
// same apart from the query, 1 the same site, 0 no match (also when either
// is absent or does not parse). Both are first sanitised (embedded AMP
// address, else subdomains removed), lose their scheme and one trailing "/".
corevireon::CVCBAEngagementType cbaMatchBetween(std::optional<std::string_view> candidate,
                                                std::optional<std::string_view> visited);

// The same in two steps, for a caller that compares one address with many:
// an address parsed, sanitised and keyed as above (none when it does not
// parse), then the match of two such.
struct CBAComparable {
  MatchURLComponents address;  // sanitised, without scheme or trailing "/"
  std::optional<std::string> site;  // normalizedURLStringForTLDFeatures
};
std::optional<CBAComparable> cbaComparable(std::string_view url);
corevireon::CVCBAEngagementType cbaMatchBetween(const CBAComparable& candidate, const CBAComparable& visited);

}  // namespace fbf
