#include "resources/lookup.h"

#include <fcntl.h>
#include <unistd.h>

#include <cerrno>

#include "core/logging.h"
#include "core/names.h"
#include "core/resource_versions.h"
#include "platform/defaults.h"
#include "platform/ipc/unix_socket.h"
#include "platform/transactions.h"
#include "resources/lookup_hints.h"
#include "resources/resource_identifier.h"

namespace tavix {

namespace {

platform::Logger& log() { return TavixLogForCategory(TavixLoggingCategoryLookUp); }

const char* keyForKind(int sourceKind) {
  return sourceKind == kTVXLookupSourceKindMonthly ? kTVXLookupHintsMonthly : kTVXLookupHintsWeekly;
}

std::string text(const platform::Dictionary& info, const char* key) {
  auto it = info.find(key);
  return it != info.end() && it->second.string() ? *it->second.string() : std::string();
}

}  // namespace

std::shared_ptr<Lookup> Lookup::create(Environment env) {
  std::shared_ptr<Lookup> lookup(new Lookup(std::move(env)));
  lookup->start();
  return lookup;
}

Lookup::Lookup(Environment env) : env_(std::move(env)), queue_(*env_.pool, "com.norvel.tavix.Lookup") {}

Lookup::~Lookup() {
  downloaded_.reset();
  deleted_.reset();
  startup_.reset();
}

void Lookup::start() {
  std::weak_ptr<Lookup> weak = weak_from_this();
  auto onFile = [weak](const platform::Notification& n) {
    if (auto self = weak.lock()) self->handleHintsFile(n);
  };
  downloaded_ = env_.center->addObserver(kTVXFileDownloadCompletedNotification, nullptr, nullptr, onFile);
  deleted_ = env_.center->addObserver(kTVXFileDeletedNotification, nullptr, nullptr, onFile);
  startup_ = env_.center->addObserver(kTVXStartupNotification, nullptr, nullptr, [weak](const platform::Notification&) {
    if (auto self = weak.lock()) self->reprocessHintsFiles();
  });
}

bool lookupEnabled(const platform::UserDefaults& defaults) {
  return !defaults.suite(kLookupSharedSuite)->boolForKey(kLookupSuggestionsDisabledKey);
}

bool Lookup::lookupEnabled() const { return tavix::lookupEnabled(*env_.defaults); }

std::string Lookup::signatureFromURL(std::string_view url) { return tavix::signatureFromURL(url); }

void Lookup::drainQueue() { queue_.sync([] {}); }

std::map<std::string, std::string> Lookup::versions() const {
  return env_.resourceVersions ? env_.resourceVersions->resourceVersions() : std::map<std::string, std::string>{};
}

void Lookup::handleHintsFile(const platform::Notification& notification) {
  const std::string identifier = text(notification.userInfo, "identifier");
  if (!isLookupResource(identifier)) return;
  const int kind = identifier == kTVXLookupHintsMonthly ? kTVXLookupSourceKindMonthly : kTVXLookupSourceKindWeekly;
  const std::string location = text(notification.userInfo, "url");  // none for a deletion
  auto transaction = std::make_shared<platform::TransactionTracker::Transaction>(
      env_.transactions->begin("_handleHintsFile"));
  std::weak_ptr<Lookup> weak = weak_from_this();
  queue_.async([weak, identifier, location, kind, transaction] {
    if (auto self = weak.lock()) self->handleHintsFile(identifier, location, kind);
  });
}

void Lookup::handleHintsFile(const std::string& identifier, const std::string& location, int sourceKind) {
  queue_.assertCurrent("Lookup::handleHintsFile");
  log().notice("processing lookup hints for location: {} sourceKind: {}", location, sourceKind);
  platform::ipc::UniqueFd fd;
  if (!location.empty()) {
    // The download manager keeps each resource under its identifier; the URL only says it arrived.
    const auto path = env_.cachesFolder / identifier;
    fd.reset(::open(path.c_str(), O_RDONLY | O_CLOEXEC));
    if (!fd.valid()) {
      log().error("error trying to open hints file: {} at location: {}",
                  std::error_code(errno, std::generic_category()).message(), path.string());
    }
  }
  // Without a file (deleted, or unreadable) the kind is cleared.
  pushHintsSourceFile(fd.get(), sourceKind, fd.valid() ? versions()[identifier] : std::string());
}

bool Lookup::pushHintsSourceFile(int fd, int sourceKind, const std::string& signature) {
  if (env_.store->hintsSourcePushFile(sourceKind, fd, signature)) return true;
  log().notice("failed to push data to the text scanner");
  return false;
}

void Lookup::reprocessHintsFiles() {
  log().notice("reprocessing lookup hints files");
  auto transaction = std::make_shared<platform::TransactionTracker::Transaction>(
      env_.transactions->begin("_reprocessHintsFiles"));
  std::weak_ptr<Lookup> weak = weak_from_this();
  queue_.async([weak, transaction] {
    auto self = weak.lock();
    if (!self) return;
    const auto versions = self->versions();
    self->reprocessHintsFile(kTVXLookupSourceKindMonthly, versions);
    self->reprocessHintsFile(kTVXLookupSourceKindWeekly, versions);
  });
}

void Lookup::reprocessHintsFile(int sourceKind, const std::map<std::string, std::string>& versions) {
  queue_.assertCurrent("Lookup::reprocessHintsFile");
  const char* key = keyForKind(sourceKind);
  const auto it = versions.find(key);
  const std::string version = it == versions.end() ? std::string() : it->second;
  const std::string signature = env_.store->hintsSourceGetClientSignature(sourceKind);
  if (signature == version) return;
  log().info("signature ({}) does not match version ({}), hints for kind: {} requires reprocessing", signature,
             version, sourceKind);
  const auto path = env_.cachesFolder / key;
  platform::ipc::UniqueFd fd(::open(path.c_str(), O_RDONLY | O_CLOEXEC));
  if (!fd.valid()) {
    log().info("reprocess file doesn't exist or there was an error. file: {} error: {}", path.string(),
               std::error_code(errno, std::generic_category()).message());
    return;
  }
  pushHintsSourceFile(fd.get(), sourceKind, version);
}

}  // namespace tavix
