// tavix-search-provider: offers tavixd's results to the desktop's search overlay through the
// search-provider interface that desktop shells call on the session bus
// (org.gnome.Shell.SearchProvider2).
//
// Each result set the shell asks for is one keystroke search through libtavix; the results are
// remembered under identifiers the shell hands back for their metas and when one is activated.
// Activating a result reports its engagement to the daemon and opens its URL with the opener
// (xdg-open).
//
// Threading: everything runs on the thread that runs the sd-event loop; libtavix replies come on
// the client's reader thread and are handed over to it through an eventfd.
#pragma once

#include <sys/types.h>

#include <cstdint>
#include <deque>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <string>
#include <vector>

#include <systemd/sd-bus.h>
#include <systemd/sd-event.h>

#include "tavix/client.h"

namespace tavix::search_provider {

inline constexpr const char* kBusName = "com.norvel.tavixd.SearchProvider";
inline constexpr const char* kObjectPath = "/com/norvel/tavixd/SearchProvider";
inline constexpr const char* kInterface = "org.gnome.Shell.SearchProvider2";
inline constexpr const char* kIdentifier = "com.norvel.tavixd.SearchProvider";

struct Options {
  std::string socketPath;         // empty: libtavix's default
  std::string opener = "xdg-open";  // run as `opener URL` for an activated result
  double exitWhenIdle = 0;        // seconds without a call before leaving the bus; 0: never
};

// One result as the shell sees it.
struct Result {
  std::string id;
  std::string name;
  std::string description;
  std::string url;
  std::uint64_t queryId = 0;
  std::string input;  // what had been typed
};

// The results of a search reply (the server's JSON), at most `limit`, with identifiers made from
// the query id. A reply that is not JSON or has no results gives none.
std::vector<Result> resultsFromReply(const std::string& data, std::uint64_t queryId, const std::string& input,
                                     std::size_t limit);

class SearchProvider {
 public:
  // Exports the interface on `bus` (which must be attached to `event`); both must outlive this.
  SearchProvider(Options options, sd_bus* bus, sd_event* event);
  ~SearchProvider();
  SearchProvider(const SearchProvider&) = delete;
  SearchProvider& operator=(const SearchProvider&) = delete;

  // 0 when the object is exported and the loop can run, else a negative errno.
  int start();

 private:
  static int onGetInitialResultSet(sd_bus_message* m, void* self, sd_bus_error* error);
  static int onGetSubsearchResultSet(sd_bus_message* m, void* self, sd_bus_error* error);
  static int onGetResultMetas(sd_bus_message* m, void* self, sd_bus_error* error);
  static int onActivateResult(sd_bus_message* m, void* self, sd_bus_error* error);
  static int onLaunchSearch(sd_bus_message* m, void* self, sd_bus_error* error);
  static int onWake(sd_event_source* source, int fd, std::uint32_t events, void* self);
  static int onIdle(sd_event_source* source, std::uint64_t usec, void* self);

  // Searches for `terms` and answers `call` with the identifiers of the results, later.
  int search(sd_bus_message* call, const std::vector<std::string>& terms);
  void remember(const std::vector<Result>& results);
  const Result* find(const std::string& id) const;
  void activate(const Result& result, int trigger);
  void open(const std::string& url);
  // Runs `task` on the loop's thread; safe from any thread.
  void post(std::function<void()> task);
  void touch();  // a call came: the idle time starts again

  Options options_;
  sd_bus* bus_;
  sd_event* event_;
  sd_bus_slot* slot_ = nullptr;
  sd_event_source* wakeSource_ = nullptr;
  sd_event_source* idleSource_ = nullptr;
  int wakeFd_ = -1;
  std::mutex postedLock_;
  std::vector<std::function<void()>> posted_;

  std::unique_ptr<client::Client> client_;
  std::uint64_t lastQueryId_ = 0;
  int pendingSearches_ = 0;
  // The results of the last searches, oldest first, bounded: the shell asks only about recent ones.
  std::deque<Result> results_;
};

}  // namespace tavix::search_provider
