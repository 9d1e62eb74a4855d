#include "upload/url_request_builder.h"

#include "platform/logging.h"
#include "util/lock.h"

#include <uriparser/Uri.h>

#include <algorithm>

namespace fbf {
namespace {

spdlog::logger& log() { return logging::get("VireonURLRequestBuilder"); }

bool isSchemeChar(char c, bool first) {
  bool alpha = (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z');
  if (first) return alpha;
  return alpha || (c >= '0' && c <= '9') || c == '+' || c == '-' || c == '.';
}

int hexValue(char c) {
  if (c >= '0' && c <= '9') return c - '0';
  if (c >= 'a' && c <= 'f') return c - 'a' + 10;
  if (c >= 'A' && c <= 'F') return c - 'A' + 10;
  return -1;
}

// "%XX" sequences become their byte; a malformed sequence stays as written.
std::string percentDecode(std::string_view s) {
  std::string out;
  out.reserve(s.size());
  for (size_t i = 0; i < s.size(); ++i) {
    if (s[i] == '%' && i + 2 < s.size()) {
      int hi = hexValue(s[i + 1]), lo = hexValue(s[i + 2]);
      if (hi >= 0 && lo >= 0) {
        out.push_back(static_cast<char>(hi * 16 + lo));
        i += 2;
        continue;
      }
    }
    out.push_back(s[i]);
  }
  return out;
}

bool isValidUTF8(std::string_view s) {
  size_t i = 0;
  while (i < s.size()) {
    auto c = static_cast<unsigned char>(s[i]);
    size_t len;
    uint32_t cp;
    if (c < 0x80) {
      ++i;
      continue;
    } else if ((c & 0xE0) == 0xC0) {
      len = 2;
      cp = c & 0x1F;
    } else if ((c & 0xF0) == 0xE0) {
      len = 3;
      cp = c & 0x0F;
    } else if ((c & 0xF8) == 0xF0) {
      len = 4;
      cp = c & 0x07;
    } else {
      return false;
    }
    if (i + len > s.size()) return false;
    for (size_t k = 1; k < len; ++k) {
      auto cc = static_cast<unsigned char>(s[i + k]);
      if ((cc & 0xC0) != 0x80) return false;
      cp = (cp << 6) | (cc & 0x3F);
    }
    static constexpr uint32_t kMin[] = {0, 0, 0x80, 0x800, 0x10000};
    if (cp < kMin[len] || cp > 0x10FFFF || (cp >= 0xD800 && cp <= 0xDFFF)) return false;
    i += len;
  }
  return true;
}

}  // namespace

// ---- URLComponents ----

std::optional<URLComponents> URLComponents::parse(std::string_view text) {
  std::string owned(text);
  UriUriA uri;
  const char* errorPos = nullptr;
  int rc = uriParseSingleUriExA(&uri, owned.data(), owned.data() + owned.size(), &errorPos);
  if (rc != URI_SUCCESS) return std::nullopt;
  uriFreeUriMembersA(&uri);

  // The reference is valid, so the generic split of RFC 3986 (appendix B)
  // gives its parts exactly.
  URLComponents c;
  std::string_view rest = text;
  if (auto hash = rest.find('#'); hash != std::string_view::npos) {
    c.fragment = std::string(rest.substr(hash + 1));
    rest = rest.substr(0, hash);
  }
  if (auto q = rest.find('?'); q != std::string_view::npos) {
    c.percentEncodedQuery = std::string(rest.substr(q + 1));
    rest = rest.substr(0, q);
  }
  if (auto colon = rest.find(':'); colon != std::string_view::npos && colon > 0) {
    auto candidate = rest.substr(0, colon);
    bool ok = candidate.find('/') == std::string_view::npos;
    for (size_t i = 0; ok && i < candidate.size(); ++i) ok = isSchemeChar(candidate[i], i == 0);
    if (ok) {
      c.scheme = std::string(candidate);
      rest = rest.substr(colon + 1);
    }
  }
  if (rest.substr(0, 2) == "//") {
    rest = rest.substr(2);
    auto slash = rest.find('/');
    c.authority = std::string(rest.substr(0, slash));
    rest = slash == std::string_view::npos ? std::string_view() : rest.substr(slash);
  }
  c.path = std::string(rest);
  return c;
}

std::vector<QueryItem> URLComponents::queryItems() const {
  std::vector<QueryItem> items;
  if (!percentEncodedQuery) return items;
  std::string_view q = *percentEncodedQuery;
  while (!q.empty()) {
    auto amp = q.find('&');
    auto piece = q.substr(0, amp);
    q = amp == std::string_view::npos ? std::string_view() : q.substr(amp + 1);
    if (piece.empty()) continue;
    auto eq = piece.find('=');
    if (eq == std::string_view::npos) {
      items.push_back({percentDecode(piece), std::nullopt});
    } else {
      items.push_back({percentDecode(piece.substr(0, eq)), percentDecode(piece.substr(eq + 1))});
    }
  }
  return items;
}

std::string URLComponents::string() const {
  std::string out;
  if (scheme) out += *scheme + ":";
  if (authority) out += "//" + *authority;
  out += path;
  if (percentEncodedQuery && !percentEncodedQuery->empty()) out += "?" + *percentEncodedQuery;
  if (fragment) out += "#" + *fragment;
  return out;
}

// ---- VireonURLRequestBuilder ----

std::unique_ptr<VireonURLRequestBuilder> VireonURLRequestBuilder::requestBuilderWithURL(std::string_view url) {
  return std::make_unique<VireonURLRequestBuilder>(url);
}

VireonURLRequestBuilder::VireonURLRequestBuilder(std::string_view url)
    : VireonURLRequestBuilder([&] {
        auto c = URLComponents::parse(url);
        if (!c) FBF_FATAL("VireonURLRequestBuilder was given a URL that cannot be parsed");
        return *c;
      }()) {}

VireonURLRequestBuilder::VireonURLRequestBuilder(URLComponents components) : urlComponents_(std::move(components)) {
  forceQueryItemsFrom(urlComponents_.queryItems());
}

void VireonURLRequestBuilder::defaultQueryItemWithName(const std::string& name, std::optional<std::string> value) {
  defaultQueryItem({name, std::move(value)});
}

void VireonURLRequestBuilder::defaultQueryItem(QueryItem item) {
  if (queryItems_.contains(item.name)) return;
  auto name = item.name;
  queryItems_.emplace(std::move(name), std::move(item));
}

void VireonURLRequestBuilder::forceQueryItemWithName(const std::string& name, std::optional<std::string> value) {
  forceQueryItem({name, std::move(value)});
}

void VireonURLRequestBuilder::forceQueryItem(QueryItem item) {
  auto name = item.name;
  queryItems_.insert_or_assign(std::move(name), std::move(item));
}

void VireonURLRequestBuilder::forceQueryItemsFrom(const std::optional<std::vector<QueryItem>>& items) {
  if (!items) return;
  for (const auto& item : *items) forceQueryItem(item);
}

bool VireonURLRequestBuilder::containsQueryItem(const std::string& name) const { return queryItems_.contains(name); }

void VireonURLRequestBuilder::defaultHttpHeader(const std::string& name, const std::string& value) {
  httpHeader_.try_emplace(name, value);
}

void VireonURLRequestBuilder::forceHttpHeader(const std::string& name, const std::string& value) {
  httpHeader_.insert_or_assign(name, value);
}

bool VireonURLRequestBuilder::containsHttpHeader(const std::string& name) const { return httpHeader_.contains(name); }

bool VireonURLRequestBuilder::containsHttpHeader(const std::string& name, const std::string& value) const {
  auto it = httpHeader_.find(name);
  return it != httpHeader_.end() && it->second == value;
}

std::optional<std::string> VireonURLRequestBuilder::percentEncodeQueryComponent(std::string_view text) {
  if (!isValidUTF8(text)) return std::nullopt;
  static constexpr char kHex[] = "0123456789ABCDEF";
  std::string out;
  out.reserve(text.size());
  for (char ch : text) {
    auto c = static_cast<unsigned char>(ch);
    bool literal = (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') || (c >= '0' && c <= '9') || c == '-' ||
                   c == '_' || c == '.' || c == '~';
    if (literal) {
      out.push_back(ch);
    } else {
      out.push_back('%');
      out.push_back(kHex[c >> 4]);
      out.push_back(kHex[c & 0xF]);
    }
  }
  return out;
}

std::string VireonURLRequestBuilder::encodeQueryItems(const std::vector<QueryItem>& items) {
  std::string out;
  bool first = true;
  for (const auto& item : items) {
    auto name = percentEncodeQueryComponent(item.name);
    if (!name) continue;
    std::string piece = *name;
    if (item.value) {
      if (auto value = percentEncodeQueryComponent(*item.value)) piece += "=" + *value;
    }
    if (!first) out += "&";
    out += piece;
    first = false;
  }
  return out;
}

HttpRequest VireonURLRequestBuilder::createUrlRequest() const {
  std::vector<QueryItem> items;
  items.reserve(queryItems_.size());
  for (const auto& [name, item] : queryItems_) items.push_back(item);
  std::stable_sort(items.begin(), items.end(), [](const QueryItem& a, const QueryItem& b) { return a.name < b.name; });

  URLComponents components = urlComponents_;
  components.percentEncodedQuery = encodeQueryItems(items);

  if (components.scheme != "http" && components.scheme != "https") {
    log().error("Scheme for url is neither http nor https.");
    throw URLError();
  }
  HttpRequest request;
  request.url = components.string();
  request.method = "GET";
  request.timeout = std::chrono::seconds(60);
  request.ignoreLocalCache = false;
  for (const auto& [name, value] : httpHeader_) request.headers.emplace_back(name, value);
  return request;
}

}  // namespace fbf
