#include "platform/log.h"

#include <sys/uio.h>
#include <syslog.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <cstdio>
#include <mutex>

#include <spdlog/logger.h>
#include <spdlog/sinks/stdout_color_sinks.h>
#include <systemd/sd-journal.h>

#include "platform/service_manager.h"

namespace tavix::platform {

struct LogCapture::Impl {
  mutable std::mutex lock;
  std::vector<Line> lines;
};

namespace {

std::atomic<LogLevel> gLevel{LogLevel::Info};

// Captures are few and short-lived (tests); a plain list under a mutex is enough.
std::mutex gCapturesLock;
std::vector<std::shared_ptr<LogCapture::Impl>>& captures() {
  static auto* list = new std::vector<std::shared_ptr<LogCapture::Impl>>();
  return *list;
}
std::atomic<int> gCaptureCount{0};

spdlog::level::level_enum toSpdlog(LogLevel level) {
  switch (level) {
    case LogLevel::Debug: return spdlog::level::debug;
    case LogLevel::Info:
    case LogLevel::Default: return spdlog::level::info;
    case LogLevel::Error: return spdlog::level::err;
    case LogLevel::Fault: return spdlog::level::critical;
  }
  return spdlog::level::info;
}

std::shared_ptr<spdlog::sinks::sink> stderrSink() {
  static auto sink = std::make_shared<spdlog::sinks::stderr_color_sink_mt>(spdlog::color_mode::never);
  return sink;
}

// Decided once: a process does not change where its stderr goes.
bool toJournal() {
  static const bool journal = stderrIsJournal();
  return journal;
}

int journalPriority(LogLevel level) {
  switch (level) {
    case LogLevel::Debug: return LOG_DEBUG;
    case LogLevel::Info: return LOG_INFO;
    case LogLevel::Default: return LOG_NOTICE;
    case LogLevel::Error: return LOG_ERR;
    case LogLevel::Fault: return LOG_CRIT;
  }
  return LOG_INFO;
}

// One journal entry with the logger's names in fields of their own, so that
// `journalctl CATEGORY=Tavix_Bag` selects one category. Should the journal refuse it, the line
// goes to stderr (the journal's stream) with a priority prefix, so the level survives.
void writeToJournal(LogLevel level, const std::string& subsystem, const std::string& category,
                    std::string_view message) {
  const int priority = journalPriority(level);
  const std::string fields[] = {
      "MESSAGE=" + std::string(message),
      "PRIORITY=" + std::to_string(priority),
      "SUBSYSTEM=" + subsystem,
      "CATEGORY=" + category,
      std::string("SYSLOG_IDENTIFIER=") + program_invocation_short_name,
      "TID=" + std::to_string(::gettid()),
  };
  iovec vectors[std::size(fields)];
  for (std::size_t i = 0; i < std::size(fields); ++i) {
    vectors[i].iov_base = const_cast<char*>(fields[i].data());
    vectors[i].iov_len = fields[i].size();
  }
  if (sd_journal_sendv(vectors, static_cast<int>(std::size(fields))) >= 0) return;
  std::fprintf(stderr, "<%d>%s: %.*s\n", priority, category.c_str(), static_cast<int>(message.size()), message.data());
}

}  // namespace

bool parseLogLevel(std::string_view text, LogLevel* out) {
  static const std::pair<std::string_view, LogLevel> kNames[] = {
      {"debug", LogLevel::Debug}, {"info", LogLevel::Info},   {"default", LogLevel::Default},
      {"error", LogLevel::Error}, {"fault", LogLevel::Fault},
  };
  for (const auto& [name, level] : kNames) {
    if (text == name) {
      *out = level;
      return true;
    }
  }
  return false;
}

void setLogLevel(LogLevel level) { gLevel.store(level); }

struct Logger::Impl {
  spdlog::logger logger;
};

Logger::Logger(std::string subsystem, std::string category)
    : subsystem_(std::move(subsystem)),
      category_(std::move(category)),
      impl_(std::make_unique<Impl>(Impl{spdlog::logger(subsystem_ + ":" + category_, stderrSink())})) {
  impl_->logger.set_pattern("%Y-%m-%d %H:%M:%S.%e %t %n <%l> %v");
  impl_->logger.set_level(spdlog::level::trace);
}

Logger::~Logger() = default;

bool Logger::wants(LogLevel level) const {
  // "Default" sits with info in spdlog but is always above debug in ours.
  return level >= gLevel.load() || gCaptureCount.load(std::memory_order_relaxed) > 0;
}

void Logger::write(LogLevel level, std::string_view message) {
  if (level >= gLevel.load()) {
    if (toJournal()) {
      writeToJournal(level, subsystem_, category_, message);
    } else {
      impl_->logger.log(toSpdlog(level), message);
    }
  }
  if (gCaptureCount.load(std::memory_order_relaxed) == 0) return;
  std::lock_guard<std::mutex> guard(gCapturesLock);
  for (auto& capture : captures()) {
    std::lock_guard<std::mutex> lines(capture->lock);
    capture->lines.push_back(LogCapture::Line{category_, level, std::string(message)});
  }
}

LogCapture::LogCapture() : impl_(std::make_shared<Impl>()) {
  std::lock_guard<std::mutex> guard(gCapturesLock);
  captures().push_back(impl_);
  gCaptureCount.fetch_add(1);
}

LogCapture::~LogCapture() {
  std::lock_guard<std::mutex> guard(gCapturesLock);
  auto& list = captures();
  list.erase(std::remove(list.begin(), list.end(), impl_), list.end());
  gCaptureCount.fetch_sub(1);
}

std::vector<LogCapture::Line> LogCapture::lines() const {
  std::lock_guard<std::mutex> guard(impl_->lock);
  return impl_->lines;
}

std::size_t LogCapture::count(std::string_view text) const {
  std::lock_guard<std::mutex> guard(impl_->lock);
  return static_cast<std::size_t>(std::count_if(impl_->lines.begin(), impl_->lines.end(),
                                                [&](const Line& l) { return l.message.find(text) != std::string::npos; }));
}

void LogCapture::clear() {
  std::lock_guard<std::mutex> guard(impl_->lock);
  impl_->lines.clear();
}

}  // namespace tavix::platform
