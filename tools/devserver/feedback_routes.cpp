#include "devserver/feedback_routes.h"

#include <openssl/evp.h>
#include <zlib.h>

#include <fstream>
#include <memory>

#include "platform/json_value.h"
#include "platform/raw_deflate.h"
#include "platform/strings.h"

namespace tavix::devserver {

namespace {

using json = nlohmann::json;

constexpr const char* kHeldEncodingHeader = "X-Devserver-Content-Encoding";

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
  return tavix::platform::hexString(std::string_view(reinterpret_cast<const char*>(digest), size));
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
    auto reject = [&res](const std::string& why) {
      res.status = 400;
      res.set_content(json{{"error", why}}.dump(), "application/json");
    };
    if (encoding != "deflate") return reject("expected Content-Encoding: deflate");
    const auto inflated = platform::inflateRaw(req.body);
    if (!inflated) return reject("body is not raw DEFLATE");
    const std::string& plain = *inflated;
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
