// The persistent record of a background session's transfers, so that a task enqueued before the
// process stops is found and started again at the next start.
//
// One folder per session. Each entry is "<prefix>.<n>.task" (the request and the session's own
// values as JSON) and, for entries with a body, "<prefix>.<n>.body". Both are written atomically
// with mode 0600, the body first: a task file is only ever found beside a complete body. Files a
// crash left half-way (a body without its task, a temporary file of an atomic write) are removed
// when the journal is opened.
//
// Threading: not thread-safe; the owning session calls it from one queue (or under one lock).
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <vector>

#include "platform/files.h"
#include "platform/http/url_request.h"
#include "platform/property_value.h"

namespace tavix::platform {
class Logger;
}

namespace tavix::platform::http {

class TransferJournal {
 public:
  struct Record {
    std::string name;  // "<prefix>.<n>", the handle of the entry
    URLRequest request;  // without its body
    Dictionary values;   // what the session attached
    std::optional<std::string> body;
  };

  // Creates `directory` (0700) when missing and clears what a crash left. `logger` must outlive
  // the journal.
  TransferJournal(fs::path directory, std::string prefix, Logger& logger);
  TransferJournal(const TransferJournal&) = delete;
  TransferJournal& operator=(const TransferJournal&) = delete;

  // Writes a new entry; its name, or none (logged) when it could not be written whole.
  std::optional<std::string> add(const URLRequest& request, const Dictionary& values,
                                 const std::optional<std::string>& body = std::nullopt);
  // Replaces the request and values of an existing entry (the body stays). False on failure.
  bool update(const std::string& name, const URLRequest& request, const Dictionary& values);
  // Forgets an entry; an absent one is not an error.
  void remove(const std::string& name);

  // Every entry, oldest first. Entries that cannot be read are logged and removed.
  std::vector<Record> load();

  const fs::path& directory() const { return directory_; }

 private:
  std::uint64_t number(const std::string& name) const;

  fs::path directory_;
  std::string prefix_;
  Logger& logger_;
  std::uint64_t next_ = 1;
};

}  // namespace tavix::platform::http
