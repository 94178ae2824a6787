#include "network/url_request_builder.h"

#include "platform/http/url.h"

namespace tavix {

using platform::http::percentEncode;

std::optional<TavixURLRequestBuilder> TavixURLRequestBuilder::requestBuilderWithURL(std::string_view url) {
  const auto parsed = platform::http::URL::parse(url);
  if (!parsed) return std::nullopt;

  // The request keeps the URL's own spelling up to its query; only the query is rebuilt.
  TavixURLRequestBuilder builder;
  std::string_view rest = url;
  if (const auto hash = rest.find('#'); hash != std::string_view::npos) {
    builder.fragment_ = std::string(rest.substr(hash));
    rest = rest.substr(0, hash);
  }
  builder.prefix_ = std::string(rest.substr(0, rest.find('?')));
  if (const auto query = parsed->query()) {
    for (auto& [name, value] : platform::http::decodedQueryItems(*query)) {
      builder.forceQueryItemWithName(std::move(name), std::move(value));
    }
  }
  return builder;
}

void TavixURLRequestBuilder::forceQueryItem(const TVXQueryItem& item) { queryItems_[item.name] = item.value; }

void TavixURLRequestBuilder::forceQueryItemWithName(std::string name, std::optional<std::string> value) {
  queryItems_[std::move(name)] = std::move(value);
}

void TavixURLRequestBuilder::forceQueryItemsFromArray(const std::vector<TVXQueryItem>& items) {
  for (const auto& item : items) forceQueryItem(item);
}

void TavixURLRequestBuilder::defaultQueryItem(const TVXQueryItem& item) { queryItems_.try_emplace(item.name, item.value); }

void TavixURLRequestBuilder::defaultQueryItemWithName(std::string name, std::optional<std::string> value) {
  queryItems_.try_emplace(std::move(name), std::move(value));
}

bool TavixURLRequestBuilder::containsQueryItemWithName(std::string_view name) const {
  return queryItems_.find(std::string(name)) != queryItems_.end();
}

const std::optional<std::string>* TavixURLRequestBuilder::queryItemValue(std::string_view name) const {
  auto it = queryItems_.find(std::string(name));
  return it == queryItems_.end() ? nullptr : &it->second;
}

void TavixURLRequestBuilder::forceHttpHeaderWithName(std::string_view name, std::string value) {
  httpHeaders_.set(name, std::move(value));
}

void TavixURLRequestBuilder::defaultHttpHeaderWithName(std::string_view name, std::string value) {
  if (!httpHeaders_.contains(name)) httpHeaders_.set(name, std::move(value));
}

bool TavixURLRequestBuilder::containsHttpHeaderWithName(std::string_view name) const {
  return httpHeaders_.contains(name);
}

platform::http::URLRequest TavixURLRequestBuilder::createMutableUrlRequest() const {
  platform::http::URLRequest request;
  std::string url = prefix_;
  // std::map keeps names in byte order, which is the wire order.
  bool first = true;
  for (const auto& [name, value] : queryItems_) {
    url += first ? '?' : '&';
    first = false;
    url += percentEncode(name);
    if (value) {
      url += '=';
      url += percentEncode(*value);
    }
  }
  url += fragment_;
  request.url = std::move(url);
  request.headers = httpHeaders_;
  return request;
}

}  // namespace tavix
