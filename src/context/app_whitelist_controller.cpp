#include "context/app_whitelist_controller.h"

#include "context/desktop_entries.h"
#include "core/logging.h"
#include "core/names.h"
#include "platform/defaults.h"
#include "platform/transactions.h"

namespace tavix {

namespace {

platform::Logger& log() { return TavixLogForCategory(TavixLoggingCategoryDefault); }

// The whitelist's JSON parser refuses more than this anyway; a larger file is not read at all.
constexpr std::uintmax_t kMaxWhitelistBytes = 16 * 1024 * 1024;

std::optional<std::string> readWhitelist(const platform::fs::path& path) {
  std::error_code ec;
  const std::uintmax_t size = platform::fs::file_size(path, ec);
  if (!ec && size > kMaxWhitelistBytes) ec = std::make_error_code(std::errc::file_too_large);
  std::string bytes;
  if (!ec) ec = platform::readFile(path, &bytes);
  if (ec) {
    log().notice("error reading app whitelist {}", path.string() + ": " + ec.message());
    return std::nullopt;
  }
  return bytes;
}

}  // namespace

std::shared_ptr<AppWhitelistController> AppWhitelistController::create(Environment env) {
  std::shared_ptr<AppWhitelistController> controller(new AppWhitelistController(std::move(env)));
  controller->start();
  return controller;
}

AppWhitelistController::AppWhitelistController(Environment env)
    : env_(std::move(env)), backgroundQueue_(*env_.pool, "com.norvel.tavixd.AppWhitelist") {}

AppWhitelistController::~AppWhitelistController() {
  downloaded_.reset();
  watcher_.reset();
}

void AppWhitelistController::start() {
  if (auto stored = env_.defaults->stringForKey(kTVXAppWhitelistSignatureKey); stored && !stored->empty()) {
    whitelistSignature_ = std::move(stored);
  }
  std::weak_ptr<AppWhitelistController> weak = weak_from_this();
  // Off the watcher's queue: were the last reference to go there, the watcher would wait on itself.
  watcher_ = std::make_unique<DesktopEntryWatcher>(*env_.pool, *env_.clock, env_.applicationFolders, [weak, pool = env_.pool] {
    pool->post([weak] {
      if (auto self = weak.lock()) self->generateWhitelistSignature();
    });
  }, env_.debounce);
  downloaded_ = env_.center->addObserver(
      kTVXFileDownloadCompletedNotification, nullptr, nullptr, [weak](const platform::Notification& n) {
        const auto it = n.userInfo.find("identifier");
        if (it == n.userInfo.end() || it->second != platform::PropertyValue(kTVXInstalledAppWhitelist)) return;
        if (auto self = weak.lock()) self->generateWhitelistSignature();
      });
  if (!whitelistSignature()) generateWhitelistSignature();
}

std::optional<std::string> AppWhitelistController::whitelistSignature() const {
  std::lock_guard guard(lock_);
  return whitelistSignature_;
}

void AppWhitelistController::generateWhitelistSignature() {
  // One generation at a time; one that has not started yet will read the newest files anyway.
  if (generating_.exchange(true)) return;
  auto transaction =
      std::make_shared<platform::TransactionTracker::Transaction>(env_.transactions->begin("appWhitelist"));
  std::weak_ptr<AppWhitelistController> weak = weak_from_this();
  backgroundQueue_.async([weak, transaction] {
    if (auto self = weak.lock()) self->generate();
  });
}

void AppWhitelistController::generate() {
  backgroundQueue_.assertCurrent("AppWhitelistController::generate");
  // Cleared first: a change noticed from here on asks for a generation of its own.
  generating_ = false;
  log().debug("generating app whitelist");
  std::optional<std::string> signature;
  if (auto whitelist = readWhitelist(env_.cachesFolder / kTVXInstalledAppWhitelist)) {
    std::string why;
    signature = processWhitelist(*whitelist, installedApps(env_.applicationFolders), &why);
    if (!signature) log().notice("no installed app signature: {}", why);
  }
  const std::string shown = signature.value_or("(none)");
  setWhitelistSignature(std::move(signature));
  log().notice("installed app signature: {}", shown);
}

void AppWhitelistController::setWhitelistSignature(std::optional<std::string> signature) {
  if (signature) {
    env_.defaults->setObject(kTVXAppWhitelistSignatureKey, platform::PropertyValue(*signature));
  } else {
    env_.defaults->removeObject(kTVXAppWhitelistSignatureKey);
  }
  std::lock_guard guard(lock_);
  whitelistSignature_ = std::move(signature);
}

void AppWhitelistController::drainQueue() { backgroundQueue_.sync([] {}); }

}  // namespace tavix
