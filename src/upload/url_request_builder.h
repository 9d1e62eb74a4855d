// Builds upload requests: query items and header fields for one endpoint,
// with "default" (set only when absent) and "force" (set or replace)
// semantics, and a deterministic query string (items sorted by name, names
// and values percent-encoded).
//
// A builder is created, filled and used by one thread; it is not shared.
#pragma once

#include "platform/http_session.h"

#include <map>
#include <memory>
#include <optional>
#include <stdexcept>
#include <string>
#include <string_view>
#include <vector>

namespace fbf {

struct QueryItem {
  std::string name;
  std::optional<std::string> value;
  bool operator==(const QueryItem&) const = default;
};

// The parts of a URL reference, as written (the query and fragment still
// percent-encoded).
struct URLComponents {
  std::optional<std::string> scheme;
  std::optional<std::string> authority;  // userinfo@host:port, without "//"
  std::string path;
  std::optional<std::string> percentEncodedQuery;
  std::optional<std::string> fragment;

  // No value when `text` is not a valid URI reference (RFC 3986). A
  // reference without a scheme parses; it only fails to become a request.
  static std::optional<URLComponents> parse(std::string_view text);
  // The query's items, percent-decoded, in the order written; pieces without
  // "=" are items without a value; empty pieces are skipped.
  std::vector<QueryItem> queryItems() const;
  std::string string() const;
};

class VireonURLRequestBuilder {
 public:
  // Thrown by `createUrlRequest` when the scheme is neither http nor https.
  class URLError : public std::runtime_error {
   public:
    URLError() : std::runtime_error("Scheme for url is neither http nor https.") {}
  };

  // Parses `url`; a URL that cannot be parsed stops the process.
  static std::unique_ptr<VireonURLRequestBuilder> requestBuilderWithURL(std::string_view url);
  explicit VireonURLRequestBuilder(std::string_view url);
  // Keeps the query items already in the components (a later one of the same
  // name replaces an earlier one).
  explicit VireonURLRequestBuilder(URLComponents components);

  void defaultQueryItemWithName(const std::string& name, std::optional<std::string> value);
  void defaultQueryItem(QueryItem item);
  void forceQueryItemWithName(const std::string& name, std::optional<std::string> value);
  void forceQueryItem(QueryItem item);
  void forceQueryItemsFrom(const std::optional<std::vector<QueryItem>>& items);
  bool containsQueryItem(const std::string& name) const;

  void defaultHttpHeader(const std::string& name, const std::string& value);
  void forceHttpHeader(const std::string& name, const std::string& value);
  bool containsHttpHeader(const std::string& name) const;
  bool containsHttpHeader(const std::string& name, const std::string& value) const;

  // The request: the URL with the sorted, encoded query, a 60-second time-out,
  // the protocol's own cache policy, every header. Logs the error "Scheme for
  // url is neither http nor https." and throws URLError for any other scheme
  // (or none).
  HttpRequest createUrlRequest() const;

  // Pieces "name=value" (or the bare name when there is no value, or the value
  // cannot be encoded) joined by "&", in the given order. Items whose name
  // cannot be encoded are dropped. Only ASCII letters, digits and "-_.~" stay
  // literal; a string that is not valid UTF-8 cannot be encoded.
  static std::string encodeQueryItems(const std::vector<QueryItem>& items);
  // Percent-encodes with the rule above; no value for invalid UTF-8.
  static std::optional<std::string> percentEncodeQueryComponent(std::string_view text);

 private:
  std::map<std::string, QueryItem> queryItems_;
  std::map<std::string, std::string> httpHeader_;
  URLComponents urlComponents_;
};

}  // namespace fbf
