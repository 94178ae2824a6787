#include "devserver/feedback_routes.h"

#include <openssl/evp.h>
#include <zlib.h>

#include <fstream>
#include <memory>

#include "platform/json_value.h"

namespace tavix::devserver {

namespace {

using json = nlohmann::json;

constexpr const char* kHeldEncodingHeader = "X-Devserver-Content-Encoding";

std::string hex(const unsigned char* bytes, std::size_t size) {
  static constexpr char kHex[] = "0123456789abcdef";
  std::string out;
  for (std::size_t i = 0; i < size; ++i) {
    out += kHex[bytes[i] >> 4];
    out += kHex[bytes[i] & 0xf];
  }
  return out;
}

}  // namespace

std::string expectedFeedbackDigest(std::string_view plain, std::size_t chunkSize) {
  z_stream zs{};
  deflateInit2(&zs, Z_DEFAULT_COMPRESSION, Z_DEFLATED, -15, 8, Z_DEFAULT_STRATEGY);
  std::unique_ptr<EVP_MD_CTX, decltype(&EVP_MD_CTX_free)> sha(EVP_MD_CTX_new(), EVP_MD_CTX_free);
  EVP_DigestInit_ex(sha.get(), EVP_sha512(), nullptr);
  unsigned char out[4096];
  for (std::size_t offset = 0; offset < plain.size(); offset += chunkSize) {
    const std::string_view chunk = plain.substr(offset, chunkSize);
    zs.next_in = reinterpret_cast<Bytef*>(const_cast<char*>(chunk.data()));
    zs.avail_in = static_cast<uInt>(chunk.size());
    zs.next_out = out;
    zs.avail_out = sizeof out;
    do {
      EVP_DigestUpdate(sha.get(), chunk.data(), chunk.size());
      if (deflate(&zs, Z_NO_FLUSH) != Z_OK) break;
      if (zs.avail_out < sizeof out) {
        zs.next_out = out;
        zs.avail_out = sizeof out;
      }
    } while (zs.avail_in > 0);
  }
  deflateEnd(&zs);
  unsigned char digest[64];
  unsigned int size = 0;
  EVP_DigestFinal_ex(sha.get(), digest, &size);
  return hex(digest, size);
}

bool inflateRaw(std::string_view compressed, std::string* out) {
  z_stream zs{};
  if (inflateInit2(&zs, -15) != Z_OK) return false;
  zs.next_in = reinterpret_cast<Bytef*>(const_cast<char*>(compressed.data()));
  zs.avail_in = static_cast<uInt>(compressed.size());
  char buffer[16384];
  int status = Z_OK;
  while (status == Z_OK) {
    zs.next_out = reinterpret_cast<Bytef*>(buffer);
    zs.avail_out = sizeof buffer;
    status = inflate(&zs, Z_NO_FLUSH);
    out->append(buffer, sizeof buffer - zs.avail_out);
    if (status == Z_BUF_ERROR && zs.avail_in == 0) break;  // input ended before the final block
  }
  inflateEnd(&zs);
  return status == Z_STREAM_END;
}

bool FeedbackStore::add(json entry, const std::string& digest) {
  std::lock_guard guard(lock_);
  if (!digests_.insert(digest).second) {
    ++repeats_;
    return false;
  }
  if (!dataDir_.empty()) {
    std::ofstream out(dataDir_ / "feedback.jsonl", std::ios::app);
    out << entry.dump(-1, ' ', false, json::error_handler_t::replace) << '\n';
  }
  received_.push_back(std::move(entry));
  return true;
}

std::size_t FeedbackStore::repeats() const {
  std::lock_guard guard(lock_);
  return repeats_;
}

json FeedbackStore::all() const {
  std::lock_guard guard(lock_);
  return received_;
}

void FeedbackStore::reset() {
  std::lock_guard guard(lock_);
  received_ = json::array();
  digests_.clear();
  repeats_ = 0;
}

void addFeedbackRoutes(httplib::Server& server, FeedbackStore& store, const RouteWrapper& served) {
  auto upload = [&store](const httplib::Request& req, httplib::Response& res) {
    const std::string digest = req.get_header_value("X-Norvel-Digest");
    const std::string encoding = req.get_header_value(kHeldEncodingHeader);
    std::string plain;
    auto reject = [&res](const std::string& why) {
      res.status = 400;
      res.set_content(json{{"error", why}}.dump(), "application/json");
    };
    if (encoding != "deflate") return reject("expected Content-Encoding: deflate");
    if (!inflateRaw(req.body, &plain)) return reject("body is not raw DEFLATE");
    const std::string expected = expectedFeedbackDigest(plain);
    if (digest != expected) return reject("digest mismatch");
    json entry = {{"path", req.path},
                  {"type", req.get_param_value("type")},
                  {"v", req.get_param_value("v")},
                  {"digest", digest},
                  {"compressed_size", req.body.size()},
                  {"size", plain.size()}};
    // Kept as JSON only within the bounds the daemon holds documents to, so that writing it out
    // again (a recursion) stays shallow.
    if (platform::isJsonWithinLimits(plain)) {
      entry["json"] = json::parse(plain);
    } else {
      entry["text"] = plain;
    }
    store.add(std::move(entry), digest);
    res.set_content("{}", "application/json");
  };
  // httplib inflates request bodies itself, and only zlib-wrapped ones: a raw DEFLATE body would
  // be refused before any handler ran. The encoding is put aside before the body is read, so
  // the upload handler sees the bytes as sent.
  server.set_pre_routing_handler([](const httplib::Request& req, httplib::Response&) {
    if (req.method == "POST" && (req.path == "/feedback" || req.path == "/crowdsourcing")) {
      auto& headers = const_cast<httplib::Request&>(req).headers;  // the server's own, non-const request
      if (auto it = headers.find("Content-Encoding"); it != headers.end()) {
        const std::string value = it->second;
        headers.erase(it);
        headers.emplace(kHeldEncodingHeader, value);
      }
    }
    return httplib::Server::HandlerResponse::Unhandled;
  });
  server.Post("/feedback", served(upload));
  server.Post("/crowdsourcing", served(upload));
  server.Get("/_feedback", [&store](const httplib::Request&, httplib::Response& res) {
    res.set_content(store.all().dump(-1, ' ', false, json::error_handler_t::replace), "application/json");
  });
  server.Get("/_feedback_repeats", [&store](const httplib::Request&, httplib::Response& res) {
    res.set_content(json{{"repeats", store.repeats()}}.dump(), "application/json");
  });
}

}  // namespace tavix::devserver
