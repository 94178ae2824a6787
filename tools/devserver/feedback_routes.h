// The devserver's feedback back end: POST /feedback and POST /crowdsourcing take raw-DEFLATE
// bodies with an "X-Norvel-Digest" header, inflate them, check the digest and keep what arrived.
// A body whose digest was seen before is a repeat (the daemon sends a session again when it
// cannot know it got through): it is answered as accepted, counted and not kept again.
// GET /_feedback lists what was kept, GET /_feedback_repeats answers {"repeats": N}; POST /_reset
// also forgets both (through reset()).
#pragma once

#include <filesystem>
#include <functional>
#include <mutex>
#include <set>
#include <string>
#include <string_view>

#include <httplib.h>
#include <nlohmann/json.hpp>

namespace tavix::devserver {

// What the daemon's compressing stream sends as its digest for `plain`, written in
// `chunkSize`-byte writes: SHA-512 over the input of every compressor pass, a write that fills
// the 4096-byte output buffer more than once being hashed once per pass. Lower-case hex.
std::string expectedFeedbackDigest(std::string_view plain, std::size_t chunkSize = 8192);

class FeedbackStore {
 public:
  // `dataDir` (may be empty) receives feedback.jsonl, one line per accepted upload.
  explicit FeedbackStore(std::filesystem::path dataDir = {}) : dataDir_(std::move(dataDir)) {}
  void setDataDir(std::filesystem::path dataDir) { dataDir_ = std::move(dataDir); }
  // Keeps `entry` unless an upload with the same digest came before; false for such a repeat.
  bool add(nlohmann::json entry, const std::string& digest);
  nlohmann::json all() const;
  std::size_t repeats() const;
  void reset();

 private:
  mutable std::mutex lock_;
  std::filesystem::path dataDir_;
  nlohmann::json received_ = nlohmann::json::array();
  std::set<std::string> digests_;
  std::size_t repeats_ = 0;
};

using RouteWrapper = std::function<httplib::Server::Handler(httplib::Server::Handler)>;

// Adds the two upload routes (through `served`, so they are recorded and take faults) and the
// control route GET /_feedback. Call before any catch-all route. Takes the server's pre-routing
// handler (uploads' "Content-Encoding" is recorded as "X-Devserver-Content-Encoding").
void addFeedbackRoutes(httplib::Server& server, FeedbackStore& store, const RouteWrapper& served);

}  // namespace tavix::devserver
