// TavixURLRequestBuilder: collects query items and header fields by name, with "default" (first
// writer wins) and "force" (last writer wins) semantics, and makes a request whose query is sorted
// by name and strictly percent-encoded. The order in which items are added therefore matters only
// through the default/force rule, never for the bytes on the wire.
//
// Not thread-safe: one request is built by one thread.
#pragma once

#include <map>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "core/requests.h"
#include "platform/http/url_request.h"

namespace tavix {

class TavixURLRequestBuilder {
 public:
  // Parses an absolute URL (platform::http::URL) and forces every query item it already carries
  // (percent-decoded). Empty when the URL does not parse.
  static std::optional<TavixURLRequestBuilder> requestBuilderWithURL(std::string_view url);

  void forceQueryItem(const TVXQueryItem& item);
  void forceQueryItemWithName(std::string name, std::optional<std::string> value);
  void forceQueryItemsFromArray(const std::vector<TVXQueryItem>& items);
  void defaultQueryItem(const TVXQueryItem& item);
  void defaultQueryItemWithName(std::string name, std::optional<std::string> value);
  bool containsQueryItemWithName(std::string_view name) const;
  // The item of that name, if any.
  const std::optional<std::string>* queryItemValue(std::string_view name) const;

  // Header names compare case-insensitively.
  void forceHttpHeaderWithName(std::string_view name, std::string value);
  void defaultHttpHeaderWithName(std::string_view name, std::string value);
  bool containsHttpHeaderWithName(std::string_view name) const;

  // The request: the URL with its query replaced by the items sorted by name (byte order), each
  // name and value percent-encoded so that only ASCII letters, digits and "-_.~" stay as they
  // are; the header fields; method GET.
  platform::http::URLRequest createMutableUrlRequest() const;
  platform::http::URLRequest createUrlRequest() const { return createMutableUrlRequest(); }

 private:
  TavixURLRequestBuilder() = default;

  std::string prefix_;    // scheme, authority and path
  std::string fragment_;  // with its "#", or empty
  std::map<std::string, std::optional<std::string>> queryItems_;
  platform::http::HeaderFields httpHeaders_;
};

}  // namespace tavix
