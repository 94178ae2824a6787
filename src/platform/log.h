// Logging: one Logger per category, backed by spdlog (kept out of this header so that every
// source that logs pays only for fmt's core).
//
// Levels follow the daemon's vocabulary: debug, info, default, error, fault. They map onto spdlog
// as debug→debug, info→info, default→info, error→error, fault→critical. Output goes to stderr,
// except when stderr is the journal's stream (a systemd service): then each line becomes a
// journal entry with its priority (default is "notice", fault "crit") and the fields SUBSYSTEM
// and CATEGORY. Threading: everything here is safe from any thread.
#pragma once

#include <memory>
#include <string>
#include <string_view>
#include <vector>

#include <fmt/core.h>

namespace tavix::platform {

enum class LogLevel { Debug, Info, Default, Error, Fault };

// Parses "debug", "info", "default", "error" or "fault"; false for anything else.
bool parseLogLevel(std::string_view text, LogLevel* out);

// The least level written by every logger (default: info). Capture sinks see every level.
void setLogLevel(LogLevel level);

class Logger {
 public:
  // `subsystem` and `category` name the logger, e.g. "com.norvel.tavixd" and "Tavix_Bag".
  Logger(std::string subsystem, std::string category);
  ~Logger();
  Logger(const Logger&) = delete;
  Logger& operator=(const Logger&) = delete;

  const std::string& category() const { return category_; }

  template <typename... Args>
  void debug(fmt::format_string<Args...> f, Args&&... args) {
    log(LogLevel::Debug, f, std::forward<Args>(args)...);
  }
  template <typename... Args>
  void info(fmt::format_string<Args...> f, Args&&... args) {
    log(LogLevel::Info, f, std::forward<Args>(args)...);
  }
  template <typename... Args>
  void notice(fmt::format_string<Args...> f, Args&&... args) {  // the "default" level
    log(LogLevel::Default, f, std::forward<Args>(args)...);
  }
  template <typename... Args>
  void error(fmt::format_string<Args...> f, Args&&... args) {
    log(LogLevel::Error, f, std::forward<Args>(args)...);
  }
  template <typename... Args>
  void fault(fmt::format_string<Args...> f, Args&&... args) {
    log(LogLevel::Fault, f, std::forward<Args>(args)...);
  }

  template <typename... Args>
  void log(LogLevel level, fmt::format_string<Args...> f, Args&&... args) {
    if (!wants(level)) return;
    write(level, fmt::format(f, std::forward<Args>(args)...));
  }

  // True when a message at `level` would go anywhere; lets callers skip costly arguments.
  bool wants(LogLevel level) const;
  void write(LogLevel level, std::string_view message);

 private:
  std::string subsystem_;
  std::string category_;
  struct Impl;
  std::unique_ptr<Impl> impl_;
};

// Records every message written while it lives, at every level, from every logger. For tests.
class LogCapture {
 public:
  struct Line {
    std::string category;
    LogLevel level;
    std::string message;
  };

  LogCapture();
  ~LogCapture();
  LogCapture(const LogCapture&) = delete;
  LogCapture& operator=(const LogCapture&) = delete;

  std::vector<Line> lines() const;
  // Lines whose message contains `text`.
  std::size_t count(std::string_view text) const;
  bool contains(std::string_view text) const { return count(text) > 0; }
  void clear();

  struct Impl;  // shared with the loggers that feed it

 private:
  std::shared_ptr<Impl> impl_;
};

}  // namespace tavix::platform
