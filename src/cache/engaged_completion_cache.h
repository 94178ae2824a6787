// The engaged-completion cache: an on-disk SQLite store of the completions the user picked for a
// typed input, and a scored prefix look-up that offers them again as local completions.
//
// Database: "<caches>/com.norvel.tavixd/EngagedCompletions/Cache.db", schema version 6.
//
// Threading: every public operation is safe from any thread. The handle is opened in SQLite's
// full-mutex mode, and every use of it, from preparing a statement to finalising it, holds the
// cache's connection lock, so that a rebuild after corruption (which closes and reopens the
// handle) never pulls it from under a statement. Adds and clears run on the caller's thread;
// searches and recency counts run on the dispatch pool (the search queue), the caller waiting for
// a search at most its time-out; parameter updates run synchronously on the serial update queue
// "com.norvel.tavixd.eccupdateq".
// Time: engagement dates come from the injected Clock; only the search time-out is a real wait.
#pragma once

#include <atomic>
#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/clock.h"
#include "platform/dispatch.h"
#include "platform/files.h"

struct sqlite3;
struct sqlite3_stmt;

namespace tavix {

namespace platform {
class UserDefaults;
}

// One local completion handed to the search path.
struct TVXSearchSuggestion {
  std::string suggestion;
  std::string query;  // the input it was found for
  double score = 0;
  int type = 0;  // 1 for origin "se", 8 for origin "3d", 0 otherwise
};

// The cache keeps each client's completions apart under a number of its own.
enum EngagedCompletionClient : unsigned long {
  kEngagedCompletionClientOther = 0,
  kEngagedCompletionClientBrovane = 1,
  kEngagedCompletionClientSeekara = 2,
};

// Where an engaged completion came from: a Tavix result (stored as "se"), another app's result
// ("3d") or the system search (again "se").
enum EngagedCompletionOrigin : int {
  kEngagedCompletionOriginUnknown = 0,
  kEngagedCompletionOriginTavix = 1,
  kEngagedCompletionOriginThirdParty = 2,
  kEngagedCompletionOriginSeekara = 3,
};

// The number of a client short name ("brovane", "seekara"); any other name is kEngagedCompletionClientOther.
inline EngagedCompletionClient engagedCompletionClientForName(std::string_view shortName) {
  if (shortName == "brovane") return kEngagedCompletionClientBrovane;
  if (shortName == "seekara") return kEngagedCompletionClientSeekara;
  return kEngagedCompletionClientOther;
}

// Scoring weights. The client connection fills them from the bag when smart history is enabled:
// "brovane_last_1hour", "brovane_last_1day", "brovane_last_1week", "brovane_last_1month",
// "brovane_all", "brovane_most_recent", "min_threshold_to_send". The defaults are the bag's.
struct EngagedCompletionParameters {
  double last1hour = 10.0;    // an engagement in the last hour
  double last1day = 1.0;      // ... in the last day
  double last1week = 0.1;     // ... in the last week
  double last1month = 0.01;   // ... in the last 30 days
  double all = 0.001;         // ... in the last 365 days
  double mostRecent = 1.0;    // weight of (newest engagement date / now)
  double minThresholdToSend = 0.0;  // results scoring below it are dropped

  bool operator==(const EngagedCompletionParameters&) const = default;
};

class EngagedCompletionCache : public std::enable_shared_from_this<EngagedCompletionCache> {
 public:
  static constexpr int kSchemaVersion = 6;
  static constexpr unsigned long kDefaultMaxRows = 10000;
  static constexpr unsigned long kDefaultTimeoutMs = 5;

  // What the cache stands on. `defaults` may be null (local completions stay enabled); `pool`
  // runs the searches; every pointer must outlive the cache.
  struct Environment {
    platform::fs::path storagePath;  // the folder that holds "EngagedCompletions"
    platform::Clock* clock = nullptr;
    platform::DispatchPool* pool = nullptr;
    platform::UserDefaults* defaults = nullptr;
  };

  // Opens or creates the database (rebuilding a missing, outdated or corrupt schema) and warms
  // up the text transforms in the background. A database that cannot be opened leaves the cache
  // inert: adds do nothing, searches return nothing.
  static std::shared_ptr<EngagedCompletionCache> create(Environment env);

  ~EngagedCompletionCache();
  EngagedCompletionCache(const EngagedCompletionCache&) = delete;
  EngagedCompletionCache& operator=(const EngagedCompletionCache&) = delete;

  const std::string& databaseDirPath() const { return databaseDirPath_; }
  const std::string& databasePath() const { return databasePath_; }

  void updateParameters(const EngagedCompletionParameters& parameters);
  EngagedCompletionParameters parameters() const;

  // Records an engagement. Ages out rows older than 30 days (all clients) and trims the client
  // to `maxRows` (10000 when 0) first. `origin` is an EngagedCompletionOrigin.
  void addCompletion(const std::string& completion, const std::string& input,
                     int origin = kEngagedCompletionOriginUnknown,
                     unsigned long client = 0, unsigned long maxRows = kDefaultMaxRows);

  // Up to `count` completions whose input or normalised completion begins with `input`, best
  // score first. nullopt when disabled, without a database, or when the search took longer than
  // `timeoutMs` (its late results are dropped).
  std::optional<std::vector<TVXSearchSuggestion>> completionsForInput(const std::string& input, unsigned long client,
                                                                      unsigned long count,
                                                                      unsigned long timeoutMs = kDefaultTimeoutMs);
  std::optional<TVXSearchSuggestion> completionForInput(const std::string& input, unsigned long client = 0);

  // Asynchronously counts the matching rows by recency bucket ('h', 'd', 'w', 'm', 'y'); the
  // callback runs on the search queue. Nothing happens when disabled or without a database.
  void featureCountsForInput(const std::string& input, unsigned long client,
                             std::function<void(std::map<std::string, std::int64_t>)> completion);

  // Deletes rows dated within [from, to] (widened by 5 s each way when from == to).
  void clearCompletionsFromDate(platform::TimePoint from, platform::TimePoint to, unsigned long client = 0);
  void clearAllClientCompletionsFromDate(platform::TimePoint from, platform::TimePoint to);
  void clearAllCompletionsForClient(unsigned long client);
  void clearAllCompletions();
  void seekaraDidClearSuggestions();

  void closeDBConnection();
  // Reports the row count and file size, rounded to two significant digits, as counters.
  void performCounterLogging();

  // Text helpers.
  static bool containsJapanese(const std::string& text);
  static bool containsKanjiOrKatakana(const std::string& text);
  // A Hiragana reading of `text`: each word's Latin transcription turned into Hiragana. Words
  // with Kanji have no reading without a dictionary and are kept as they are.
  static std::string kanize(const std::string& text);
  // Japanese text unchanged; anything else lower-cased, stripped of diacritics, NFKD.
  static std::string normalizeString(const std::string& text);
  // "12345" -> 12000, "987" -> 980; texts of one digit read as they are.
  static std::int64_t significantValueFromString(const std::string& digits);

  // Row count of one client, or -1 on failure. For tests and tools.
  std::int64_t rowCountForClient(unsigned long client);

  // Holds the database as a long write would, until the lock is dropped. For tests.
  std::unique_lock<std::recursive_mutex> holdDatabaseForTesting() { return std::unique_lock(dbLock_); }

 private:
  explicit EngagedCompletionCache(Environment env);

  bool cacheEnabled() const;
  // The open handle, or null; the caller holds dbLock_ while it uses it.
  sqlite3* handle() const;
  bool hasDatabase() const;
  void createOrUpdateDatabaseIfNeeded();
  void openDatabaseConnection();
  bool isSchemaCurrent();
  void setDBSchema();
  void rebuildCorruptDatabase();
  void deleteDatabase();
  bool execSQLStatement(const std::string& sql);
  void deleteOldestEngagements(unsigned long limit, unsigned long client);
  std::int64_t countRows(const std::string& sql, bool* ok);
  // The search, under dbLock_. With a deadline, a search still running then is interrupted and
  // answers nullopt.
  std::optional<std::vector<TVXSearchSuggestion>> runSearch(const std::string& input, unsigned long client,
                                                            unsigned long count,
                                                            const platform::TimePoint* deadline = nullptr);
  // The search statement for the current weights and `count`, prepared once; null on failure.
  sqlite3_stmt* selectStatement(unsigned long count);
  void finalizeStatements();
  void warmup();

  Environment env_;
  std::string databaseDirPath_;
  std::string databasePath_;
  // Held across each use of the handle and across opening, closing and rebuilding it. Recursive:
  // an add runs clears and counts of its own, and a corrupt insert rebuilds, all under one hold.
  mutable std::recursive_mutex dbLock_;
  sqlite3* completionsDB_ = nullptr;  // guarded by dbLock_
  // The search statement kept prepared on completionsDB_, and what it was made for; dbLock_.
  sqlite3_stmt* select_ = nullptr;
  EngagedCompletionParameters selectParameters_;
  unsigned long selectCount_ = 0;
  std::atomic<int> schemaVersion_{0};
  platform::SerialQueue updateQueue_;
  mutable std::mutex parametersLock_;
  EngagedCompletionParameters parameters_;
};

}  // namespace tavix
