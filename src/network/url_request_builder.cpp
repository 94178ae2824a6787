#include "network/url_request_builder.h"

namespace tavix {

namespace {

bool isUnreserved(unsigned char c) {
  return (c >= 'A' && c <= 'Z') || (c >= 'a' && c <= 'z') || (c >= '0' && c <= '9') || c == '-' || c == '_' ||
         c == '.' || c == '~';
}

int hexValue(char c) {
  if (c >= '0' && c <= '9') return c - '0';
  if (c >= 'A' && c <= 'F') return c - 'A' + 10;
  if (c >= 'a' && c <= 'f') return c - 'a' + 10;
  return -1;
}

bool isSchemeChar(char c, bool first) {
  bool alpha = (c >= 'A' && c <= 'Z') || (c >= 'a' && c <= 'z');
  if (first) return alpha;
  return alpha || (c >= '0' && c <= '9') || c == '+' || c == '-' || c == '.';
}

}  // namespace

std::string TVXPercentEncode(std::string_view text) {
  static constexpr char kHex[] = "0123456789ABCDEF";
  std::string out;
  out.reserve(text.size() * 3);
  for (char ch : text) {
    auto c = static_cast<unsigned char>(ch);
    if (isUnreserved(c)) {
      out += ch;
    } else {
      out += '%';
      out += kHex[c >> 4];
      out += kHex[c & 15];
    }
  }
  return out;
}

std::string TVXPercentDecode(std::string_view text) {
  std::string out;
  out.reserve(text.size());
  for (std::size_t i = 0; i < text.size(); ++i) {
    if (text[i] == '%' && i + 2 < text.size()) {
      int hi = hexValue(text[i + 1]);
      int lo = hexValue(text[i + 2]);
      if (hi >= 0 && lo >= 0) {
        out += static_cast<char>(hi * 16 + lo);
        i += 2;
        continue;
      }
    }
    out += text[i];
  }
  return out;
}

std::optional<TavixURLRequestBuilder> TavixURLRequestBuilder::requestBuilderWithURL(std::string_view url) {
  std::size_t colon = url.find(':');
  if (colon == std::string_view::npos || colon == 0) return std::nullopt;
  for (std::size_t i = 0; i < colon; ++i) {
    if (!isSchemeChar(url[i], i == 0)) return std::nullopt;
  }
  if (url.substr(colon, 3) != "://" || url.size() == colon + 3) return std::nullopt;
  for (char c : url) {
    if (static_cast<unsigned char>(c) <= 0x20 || c == 0x7f) return std::nullopt;  // unescaped blanks or controls
  }
  std::size_t authorityEnd = url.find_first_of("/?#", colon + 3);
  if (authorityEnd == colon + 3) return std::nullopt;  // no host

  TavixURLRequestBuilder builder;
  std::string_view rest = url;
  std::size_t hash = rest.find('#');
  if (hash != std::string_view::npos) {
    builder.fragment_ = std::string(rest.substr(hash));
    rest = rest.substr(0, hash);
  }
  std::size_t question = rest.find('?');
  builder.prefix_ = std::string(rest.substr(0, question));
  if (question != std::string_view::npos) {
    std::string_view query = rest.substr(question + 1);
    while (!query.empty()) {
      std::size_t amp = query.find('&');
      std::string_view part = query.substr(0, amp);
      if (!part.empty()) {
        std::size_t eq = part.find('=');
        if (eq == std::string_view::npos) {
          builder.forceQueryItemWithName(TVXPercentDecode(part), std::nullopt);
        } else {
          builder.forceQueryItemWithName(TVXPercentDecode(part.substr(0, eq)), TVXPercentDecode(part.substr(eq + 1)));
        }
      }
      if (amp == std::string_view::npos) break;
      query = query.substr(amp + 1);
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
    url += TVXPercentEncode(name);
    if (value) {
      url += '=';
      url += TVXPercentEncode(*value);
    }
  }
  url += fragment_;
  request.url = std::move(url);
  request.headers = httpHeaders_;
  return request;
}

}  // namespace tavix
