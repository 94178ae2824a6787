// Feeds arbitrary bytes to the session-file reader as the contents of a "session." file, the way
// the flusher meets files left by an earlier run (cut off, damaged or foreign), and builds the
// upload record of every session that is accepted: sorting, privacy filtering and, for browser
// agents, the completion-bar filter with whatever URLs the file holds.
//
// Run: UBSAN_OPTIONS=halt_on_error=1 <build>/bin/session_file_fuzzer -max_total_time=300 [corpus-dir]
// (undefined behaviour only warns otherwise, and the run would go on past it).
#include <unistd.h>

#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <memory>
#include <string>

#include <nlohmann/json.hpp>

#include "core/assembly.h"
#include "feedback/client_session.h"
#include "feedback/persistent_storage.h"
#include "platform/clock.h"
#include "platform/dispatch.h"
#include "platform/files.h"
#include "platform/log.h"
#include "tavix_proto/feedback_session.pb.h"

namespace {

using namespace tavix;

constexpr std::uint64_t kMaxFileSize = 1 << 20;

struct Harness {
  platform::DispatchPool pool{1};
  platform::SerialQueue queue{pool, "com.norvel.tavixd.persistentStorageQueue"};
  platform::VirtualClock clock;
  Assembly assembly;
  platform::fs::path file;

  Harness() {
    platform::setLogLevel(platform::LogLevel::Fault);
    assembly.dispatchPool = &pool;
    assembly.clock = &clock;
    const char* shm = ::access("/dev/shm", W_OK) == 0 ? "/dev/shm" : "/tmp";
    file = platform::fs::path(shm) / ("session_file_fuzzer." + std::to_string(::getpid())) / "session.1";
    platform::fs::create_directories(file.parent_path());
  }
  ~Harness() { platform::fs::remove_all(file.parent_path()); }
};

Harness& harness() {
  static auto* h = new Harness();  // lives for the whole run; the process ends without teardown
  return *h;
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  Harness& h = harness();
  if (platform::writeFileAtomically(h.file, std::string(reinterpret_cast<const char*>(data), size), 0600)) return 0;

  // Files without a version field carry the empty version: read them as the daemon's own.
  auto container = std::make_shared<FileContainer>(h.file, std::string(), h.queue, kMaxFileSize);
  auto record = container->readRecord();
  if (!record) return 0;
  if (!record->version().empty()) std::abort();  // a foreign version must have been discarded

  // What the reader accepted must encode again and decode to the same events.
  std::string again;
  if (!record->SerializeToString(&again)) std::abort();
  proto::CTClientSession copy;
  if (!copy.ParseFromString(again) || copy.feedbacks_size() != record->feedbacks_size()) std::abort();

  const int events = record->feedbacks_size();
  auto session = ClientSession::fromRecord(h.assembly, std::move(*record));
  const std::string upload = session->getFeedbacksToSend();
  const auto json = nlohmann::json::parse(upload, nullptr, false);
  if (json.is_discarded() || !json.is_object() || json.size() != 7 || !json["fb"].is_array()) std::abort();
  // Filters only remove events; at most the two "missing" events are added in front.
  if (json["fb"].size() > static_cast<std::size_t>(events) + 2) std::abort();
  return 0;
}
