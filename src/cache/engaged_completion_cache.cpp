#include "cache/engaged_completion_cache.h"

#include <sys/stat.h>

#include <sqlite3.h>
#include <unicode/brkiter.h>
#include <unicode/locid.h>
#include <unicode/normalizer2.h>
#include <unicode/translit.h>
#include <unicode/unistr.h>

#include <algorithm>
#include <cctype>
#include <chrono>
#include <condition_variable>
#include <cstdio>
#include <cstdlib>
#include <mutex>

#include "core/diagnostics.h"
#include "core/logging.h"
#include "platform/defaults.h"
#include "platform/log.h"

namespace tavix {
namespace {

// This store writes to the default log rather than to one of the daemon's categories.
platform::Logger& eccLog() {
  static platform::Logger logger(kTavixLogSubsystem, "default");
  return logger;
}

constexpr const char* kDatabaseDirName = "EngagedCompletions";
constexpr const char* kDatabaseFileName = "Cache.db";
// Read-write, create, full mutex. Linux has no file-protection classes to add.
constexpr int kOpenFlags = 0x10006;
constexpr std::int64_t kMaxAgeSeconds = 2592000;  // 30 days
constexpr const char* kRangeEnd = "\xEF\xBF\xAE";  // U+FFEE: sorts after any text that follows a prefix
constexpr const char* kEntriesCounterKey = "com.norvel.tavixd.brovane.localCompletionIndex.entries";
constexpr const char* kSizeCounterKey = "com.norvel.tavixd.brovane.localCompletionIndex.size";

constexpr const char* kSelectFormat =
    "SELECT completion, origin, SUM(CASE WHEN engagement_date > ? THEN %f WHEN engagement_date > ? then %f WHEN  "
    "engagement_date > ? THEN %f WHEN engagement_date > ? THEN %f WHEN engagement_date > ? THEN %f ELSE 0 END) + (%f "
    "* MAX(engagement_date) / ?) AS score FROM completion_cache_engagement WHERE (input between %s and %s OR "
    "transformed between %s and %s) AND client == ? GROUP BY completion ORDER BY score DESC LIMIT %lu";

constexpr const char* kFeatureCountFormat =
    "SELECT F, count(*) from (SELECT completion, CASE WHEN engagement_date > ? THEN 'h' WHEN engagement_date > ? "
    "then 'd' WHEN  engagement_date > ? THEN 'w' WHEN engagement_date > ? THEN 'm' WHEN engagement_date > ? THEN 'y' "
    "END AS F FROM completion_cache_engagement WHERE (input between %s and %s OR transformed between %s and %s) AND "
    "client == ?) group by F LIMIT 1";

constexpr std::int64_t kBuckets[] = {3600, 86400, 604800, 2592000, 31536000};

// Turns each "%q" of an already formatted statement into a positional parameter.
std::string positional(const char* sql) {
  char* out = sqlite3_mprintf(sql, "?", "?", "?", "?", "?", "?");
  if (!out) return {};
  std::string result(out);
  sqlite3_free(out);
  return result;
}

// Far enough back for any stored date, near enough to fit the clock's nanosecond range.
platform::TimePoint distantPast() { return platform::fromUnixSeconds(-3.0e9); }

std::int64_t wholeSeconds(platform::TimePoint t) { return static_cast<std::int64_t>(platform::toUnixSeconds(t)); }

std::string dateText(platform::TimePoint t) { return std::to_string(wholeSeconds(t)); }

bool isCorruption(int rc) { return rc == SQLITE_IOERR || rc == SQLITE_CORRUPT || rc == SQLITE_NOTADB; }

// UTF-16 code-unit classes.
bool isKanji(char16_t u) { return (u >= 0x2E80 && u <= 0x2EFF) || (u >= 0x2F00 && u <= 0x2FDF) || (u >= 0x4E00 && u <= 0x9FAF); }
bool isKatakana(char16_t u) { return (u >= 0x30A0 && u <= 0x30FF && u != 0x30FB) || (u >= 0xFF66 && u <= 0xFF9F); }
bool isHiragana(char16_t u) { return u >= 0x3040 && u <= 0x309F; }

template <typename Pred>
bool anyUnit(const std::string& text, Pred pred) {
  icu::UnicodeString s = icu::UnicodeString::fromUTF8(text);
  for (int32_t i = 0; i < s.length(); ++i) {
    if (pred(s.charAt(i))) return true;
  }
  return false;
}

// ICU transliterators are costly to build and not safe to share unguarded: one of each, locked.
struct Transform {
  explicit Transform(const char* id) {
    UErrorCode status = U_ZERO_ERROR;
    translit.reset(icu::Transliterator::createInstance(id, UTRANS_FORWARD, status));
    if (U_FAILURE(status)) translit.reset();
  }
  void apply(icu::UnicodeString& s) {
    if (!translit) return;
    std::lock_guard<std::mutex> guard(lock);
    translit->transliterate(s);
  }
  std::mutex lock;
  std::unique_ptr<icu::Transliterator> translit;
};

Transform& stripDiacritics() {
  static Transform t("NFD; [:Nonspacing Mark:] Remove; NFC");
  return t;
}

Transform& latinToHiragana() {
  static Transform t("Any-Latin; Latin-Hiragana");
  return t;
}

std::string toUTF8(const icu::UnicodeString& s) {
  std::string out;
  s.toUTF8String(out);
  return out;
}

// A statement that finalises itself.
struct Statement {
  sqlite3_stmt* stmt = nullptr;
  ~Statement() { sqlite3_finalize(stmt); }
};

}  // namespace

// Text helpers

bool EngagedCompletionCache::containsJapanese(const std::string& text) {
  return anyUnit(text, [](char16_t u) { return isKanji(u) || isKatakana(u) || isHiragana(u); });
}

bool EngagedCompletionCache::containsKanjiOrKatakana(const std::string& text) {
  return anyUnit(text, [](char16_t u) { return isKanji(u) || isKatakana(u); });
}

std::string EngagedCompletionCache::kanize(const std::string& text) {
  icu::UnicodeString s = icu::UnicodeString::fromUTF8(text);
  UErrorCode status = U_ZERO_ERROR;
  std::unique_ptr<icu::BreakIterator> words(icu::BreakIterator::createWordInstance(icu::Locale::getDefault(), status));
  if (U_FAILURE(status) || !words) return {};
  words->setText(s);
  icu::UnicodeString reading;
  for (int32_t start = words->first(), end = words->next(); end != icu::BreakIterator::DONE;
       start = end, end = words->next()) {
    icu::UnicodeString token(s, start, end - start);
    if (!anyUnit(toUTF8(token), isKanji)) latinToHiragana().apply(token);
    reading += token;
  }
  return toUTF8(reading);
}

std::string EngagedCompletionCache::normalizeString(const std::string& text) {
  // ASCII has no diacritics and no compatibility forms: lower-casing is all there is to do, and
  // it is most of what users type.
  if (std::all_of(text.begin(), text.end(), [](char c) { return static_cast<unsigned char>(c) < 0x80; })) {
    std::string lower = text;
    for (char& c : lower) c = static_cast<char>(std::tolower(static_cast<unsigned char>(c)));
    return lower;
  }
  if (containsJapanese(text)) return text;
  icu::UnicodeString s = icu::UnicodeString::fromUTF8(text);
  s.toLower(icu::Locale::getRoot());
  stripDiacritics().apply(s);
  UErrorCode status = U_ZERO_ERROR;
  const icu::Normalizer2* nfkd = icu::Normalizer2::getNFKDInstance(status);
  if (U_FAILURE(status)) return {};
  icu::UnicodeString decomposed = nfkd->normalize(s, status);
  if (U_FAILURE(status)) return {};
  return toUTF8(decomposed);
}

std::int64_t EngagedCompletionCache::significantValueFromString(const std::string& digits) {
  std::string kept = digits;
  for (std::size_t i = 2; i < kept.size(); ++i) kept[i] = '0';
  return std::strtoll(kept.c_str(), nullptr, 10);
}

// Life cycle

std::shared_ptr<EngagedCompletionCache> EngagedCompletionCache::create(Environment env) {
  std::shared_ptr<EngagedCompletionCache> cache(new EngagedCompletionCache(std::move(env)));
  cache->warmup();
  return cache;
}

EngagedCompletionCache::EngagedCompletionCache(Environment env)
    : env_(std::move(env)),
      databaseDirPath_((env_.storagePath / kDatabaseDirName).string()),
      databasePath_((env_.storagePath / kDatabaseDirName / kDatabaseFileName).string()),
      updateQueue_(*env_.pool, "com.norvel.tavixd.eccupdateq") {
  createOrUpdateDatabaseIfNeeded();
}

EngagedCompletionCache::~EngagedCompletionCache() { closeDBConnection(); }

void EngagedCompletionCache::warmup() {
  // Loads the transform machinery before the first real search needs it.
  env_.pool->post([] { normalizeString("warmup"); });
}

bool EngagedCompletionCache::cacheEnabled() const {
  return !(env_.defaults && env_.defaults->boolForKey("TVXDisableLocalCompletions"));
}

sqlite3* EngagedCompletionCache::handle() const { return completionsDB_; }

bool EngagedCompletionCache::hasDatabase() const {
  std::lock_guard hold(dbLock_);
  return completionsDB_ != nullptr;
}

void EngagedCompletionCache::finalizeStatements() {
  sqlite3_finalize(select_);
  select_ = nullptr;
}

void EngagedCompletionCache::closeDBConnection() {
  std::lock_guard hold(dbLock_);
  finalizeStatements();
  if (completionsDB_) sqlite3_close_v2(completionsDB_);
  completionsDB_ = nullptr;
}

// Schema upkeep

void EngagedCompletionCache::createOrUpdateDatabaseIfNeeded() {
  std::lock_guard hold(dbLock_);
  std::error_code ec;
  if (platform::fs::exists(databasePath_, ec)) {
    openDatabaseConnection();
    if (!isSchemaCurrent()) setDBSchema();
    return;
  }
  if (!platform::fs::is_directory(databaseDirPath_, ec)) {
    if (platform::createDirectory(databaseDirPath_, true)) {
      eccLog().error("Failed to create database dir: {}", databaseDirPath_);
      return;
    }
  }
  openDatabaseConnection();
  setDBSchema();
}

void EngagedCompletionCache::openDatabaseConnection() {
  std::lock_guard hold(dbLock_);
  if (completionsDB_) {
    eccLog().notice("Closing existing Completions database connection");
    finalizeStatements();
    sqlite3_close_v2(completionsDB_);
    completionsDB_ = nullptr;
  }
  sqlite3* db = nullptr;
  int rc = sqlite3_open_v2(databasePath_.c_str(), &db, kOpenFlags, nullptr);
  if (rc == SQLITE_OK) {
    // What the user engaged with is private: the file is the user's alone, whatever the umask.
    ::chmod(databasePath_.c_str(), 0600);
    eccLog().notice("Completions database opened: {}", databasePath_);
    completionsDB_ = db;
    return;
  }
  if (rc == SQLITE_CORRUPT) {
    // Keep the handle; the schema is rebuilt right away by the caller's schema check.
    completionsDB_ = db;
    schemaVersion_ = 0;
    return;
  }
  eccLog().error("Failed to open completions database: {} error={} cause={}", databasePath_, rc,
                 db ? sqlite3_errmsg(db) : sqlite3_errstr(rc));
  sqlite3_close_v2(db);
}

bool EngagedCompletionCache::isSchemaCurrent() {
  if (schemaVersion_ == kSchemaVersion) return true;
  sqlite3* db = completionsDB_;
  if (!db) return false;
  char** table = nullptr;
  int rows = 0, columns = 0;
  int rc = sqlite3_get_table(db, "SELECT schema_version from completion_cache_schema_version", &table, &rows,
                             &columns, nullptr);
  if (rc == SQLITE_OK) {
    bool current = false;
    if ((rows == 1 || columns == 1) && rows >= 1 && table[columns]) {
      schemaVersion_ = static_cast<int>(std::strtol(table[columns], nullptr, 10));
      current = schemaVersion_ == kSchemaVersion;
    }
    sqlite3_free_table(table);
    return current;
  }
  sqlite3_free_table(table);
  if (rc == SQLITE_BUSY) return true;
  eccLog().error("Engaged completion cache schema version read failed");
  // A file that is not a database (or one damaged beyond reading its own schema) cannot be
  // rebuilt in place: start over with an empty file.
  if (isCorruption(rc)) {
    deleteDatabase();
    openDatabaseConnection();
  }
  return false;
}

bool EngagedCompletionCache::execSQLStatement(const std::string& sql) {
  char* message = nullptr;
  int rc = sqlite3_exec(completionsDB_, sql.c_str(), nullptr, nullptr, &message);
  if (rc != SQLITE_OK) {
    eccLog().error("_execSQLStatement failed - SQL:{} error-code: {} error-message: {}", sql, rc,
                   message ? message : "");
  }
  sqlite3_free(message);
  return rc == SQLITE_OK;
}

void EngagedCompletionCache::setDBSchema() {
  if (!completionsDB_) return;
  struct Step {
    const char* sql;
    const char* failure;
  };
  static constexpr Step steps[] = {
      {"PRAGMA auto_vacuum = 2;", "Error _setDBSchema pragma auto_vacum"},
      {"DROP table IF EXISTS completion_cache_schema_version;", "Error _setDBSchema drop schema table"},
      {"CREATE table completion_cache_schema_version(schema_version INT);", "Error _setDBSchema create schema table"},
      {"DROP table IF EXISTS completion_cache_engagement;", "Error _setDBSchema drop completion_cache_engagement table"},
      {"CREATE TABLE IF NOT EXISTS completion_cache_engagement(completion TEXT, input TEXT, engagement_date INT, "
       "origin TEXT, client INT, transformed TEXT);",
       "Error _setDBSchema create completion_cache_engagement table"},
      {"CREATE INDEX transformed_index ON completion_cache_engagement(transformed);",
       "Error _setDBSchema table completion_cache_engagement create index (transformed)"},
      {"CREATE INDEX input_index ON completion_cache_engagement(input);",
       "Error _setDBSchema table completion_cache_engagement create index (input)"},
  };
  for (const Step& step : steps) {
    if (!execSQLStatement(step.sql)) eccLog().error("{}", step.failure);
  }
  char* insert = sqlite3_mprintf("INSERT INTO completion_cache_schema_version VALUES (%d)", kSchemaVersion);
  if (!insert) {
    eccLog().error("Error _setDBSchema alloc schema version string");
    return;
  }
  if (!execSQLStatement(insert)) eccLog().error("Error _setDBSchema insert schema version string");
  sqlite3_free(insert);
}

void EngagedCompletionCache::deleteDatabase() {
  std::lock_guard hold(dbLock_);
  closeDBConnection();
  std::error_code ec;
  for (const char* suffix : {"", "-journal", "-wal", "-shm"}) platform::fs::remove(databasePath_ + suffix, ec);
  schemaVersion_ = 0;
}

void EngagedCompletionCache::rebuildCorruptDatabase() {
  std::lock_guard hold(dbLock_);
  // The rows are lost either way; a fresh file is the only rebuild that works whatever the damage.
  deleteDatabase();
  createOrUpdateDatabaseIfNeeded();
}

// Parameters

void EngagedCompletionCache::updateParameters(const EngagedCompletionParameters& p) {
  updateQueue_.sync([&] {
    {
      std::lock_guard<std::mutex> guard(parametersLock_);
      parameters_ = p;
    }
    eccLog().debug(
        "EngagedCompletionCache updateParameters: (1h {:f}) (1d {:f}) (7d {:f}) (1m {:f}) (all {:f}) (recent {:f}) "
        "(t {:f})",
        p.last1hour, p.last1day, p.last1week, p.last1month, p.all, p.mostRecent, p.minThresholdToSend);
  });
}

EngagedCompletionParameters EngagedCompletionCache::parameters() const {
  std::lock_guard<std::mutex> guard(parametersLock_);
  return parameters_;
}

// Adding

std::int64_t EngagedCompletionCache::countRows(const std::string& sql, bool* ok) {
  Statement s;
  *ok = false;
  sqlite3* db = handle();
  if (!db || sqlite3_prepare_v2(db, sql.c_str(), -1, &s.stmt, nullptr) != SQLITE_OK) return 0;
  if (sqlite3_step(s.stmt) != SQLITE_ROW) return 0;
  *ok = true;
  return sqlite3_column_int64(s.stmt, 0);
}

std::int64_t EngagedCompletionCache::rowCountForClient(unsigned long client) {
  std::lock_guard hold(dbLock_);
  bool ok = false;
  std::int64_t n =
      countRows("SELECT Count(*) FROM completion_cache_engagement WHERE client == " + std::to_string(client) + ";", &ok);
  return ok ? n : -1;
}

void EngagedCompletionCache::deleteOldestEngagements(unsigned long limit, unsigned long client) {
  std::string sql = "SELECT engagement_date FROM completion_cache_engagement WHERE client == " + std::to_string(client) +
                    " ORDER BY engagement_date DESC LIMIT 1 OFFSET " + std::to_string(limit) + " ;";
  Statement s;
  if (sqlite3_prepare_v2(handle(), sql.c_str(), -1, &s.stmt, nullptr) != SQLITE_OK ||
      sqlite3_step(s.stmt) != SQLITE_ROW) {
    // With exactly `limit` rows there is no such row: the client holds limit + 1 until next time.
    eccLog().error("Failed to get engagement_date of max row item");
    return;
  }
  auto date = platform::fromUnixSeconds(static_cast<double>(sqlite3_column_int64(s.stmt, 0)));
  clearCompletionsFromDate(distantPast(), date, client);
}

void EngagedCompletionCache::addCompletion(const std::string& completion, const std::string& input, int origin,
                                           unsigned long client, unsigned long maxRows) {
  std::lock_guard hold(dbLock_);
  if (!cacheEnabled() || completion.empty() || !handle()) return;

  const platform::TimePoint now = env_.clock->now();
  clearAllClientCompletionsFromDate(distantPast(), now - platform::seconds(kMaxAgeSeconds));

  const unsigned long limit = maxRows == 0 ? kDefaultMaxRows : maxRows;
  std::int64_t rows = rowCountForClient(client);
  eccLog().debug("Number of completion in cache: {}", rows);
  if (rows >= 0 && static_cast<unsigned long>(rows) >= limit) deleteOldestEngagements(limit, client);

  char* sql = sqlite3_mprintf(
      "INSERT INTO completion_cache_engagement (completion, input, engagement_date, origin, client, transformed) "
      "VALUES (%q, %q, %q, %q, %q, %q)",
      "?", "?", "?", "?", "?", "?");
  Statement s;
  int rc = sqlite3_prepare_v2(handle(), sql, -1, &s.stmt, nullptr);
  if (rc != SQLITE_OK) {
    eccLog().error("_prepareInsertStatement failed - SQL:{} code: {}", sql, rc);
    sqlite3_free(sql);
    if (isCorruption(rc)) {
      eccLog().error("Corrupt db error while adding completion {}, rebuilding schema", completion);
      rebuildCorruptDatabase();
    }
    return;
  }
  sqlite3_free(sql);

  const std::string transformed = normalizeString(completion);
  if (transformed.empty()) return;
  eccLog().debug("Adding completion: {} input: {} transformed: {}", completion, input, transformed);

  const char* originText = (origin == kEngagedCompletionOriginTavix || origin == kEngagedCompletionOriginSeekara) ? "se"
                           : origin == kEngagedCompletionOriginThirdParty                                      ? "3d"
                                                                                                               : "";
  sqlite3_bind_text(s.stmt, 1, completion.c_str(), -1, SQLITE_TRANSIENT);
  sqlite3_bind_text(s.stmt, 2, input.c_str(), -1, SQLITE_TRANSIENT);
  sqlite3_bind_int(s.stmt, 3, static_cast<std::int32_t>(wholeSeconds(now)));
  sqlite3_bind_text(s.stmt, 4, originText, -1, SQLITE_STATIC);
  sqlite3_bind_int64(s.stmt, 5, static_cast<sqlite3_int64>(client));
  sqlite3_bind_text(s.stmt, 6, transformed.c_str(), -1, SQLITE_TRANSIENT);
  rc = sqlite3_step(s.stmt);
  if (rc != SQLITE_DONE) {
    if (isCorruption(rc)) {
      eccLog().error("Corrupt db error while adding completion {}, rebuilding schema", completion);
      sqlite3_finalize(s.stmt);
      s.stmt = nullptr;
      rebuildCorruptDatabase();
    } else {
      eccLog().error("Failed to add completion: {}", completion);
    }
  } else {
    eccLog().debug("Completion added: {} input {}", completion, input);
  }
  sqlite3_finalize(s.stmt);
  s.stmt = nullptr;
  performCounterLogging();
}

// Searching

sqlite3_stmt* EngagedCompletionCache::selectStatement(unsigned long count) {
  const EngagedCompletionParameters p = parameters();
  if (select_ && selectParameters_ == p && selectCount_ == count) return select_;
  finalizeStatements();
  // Sized to what the weights print to: a bag may send weights of hundreds of digits.
  const int length = std::snprintf(nullptr, 0, kSelectFormat, p.last1hour, p.last1day, p.last1week, p.last1month,
                                   p.all, p.mostRecent, "%q", "%q", "%q", "%q", count);
  if (length < 0) return nullptr;
  std::string formatted(static_cast<std::size_t>(length) + 1, '\0');
  std::snprintf(formatted.data(), formatted.size(), kSelectFormat, p.last1hour, p.last1day, p.last1week,
                p.last1month, p.all, p.mostRecent, "%q", "%q", "%q", "%q", count);
  const std::string sql = positional(formatted.c_str());
  sqlite3* db = handle();
  if (!db) return nullptr;
  int rc = sqlite3_prepare_v3(db, sql.c_str(), -1, SQLITE_PREPARE_PERSISTENT, &select_, nullptr);
  if (rc != SQLITE_OK) {
    eccLog().error("_prepareSelectStatement failed - SQL:{} code: {}", sql, rc);
    sqlite3_finalize(select_);
    select_ = nullptr;
    return nullptr;
  }
  selectParameters_ = p;
  selectCount_ = count;
  return select_;
}

namespace {

// Ends a statement that runs past its deadline. Looked at every few hundred virtual-machine
// steps: a clock read is cheap next to them.
struct SearchDeadline {
  platform::Clock* clock;
  platform::TimePoint at;
  static int check(void* self) {
    auto* d = static_cast<SearchDeadline*>(self);
    return d->clock->now() > d->at ? 1 : 0;
  }
};

}  // namespace

std::optional<std::vector<TVXSearchSuggestion>> EngagedCompletionCache::runSearch(
    const std::string& input, unsigned long client, unsigned long count, const platform::TimePoint* deadline) {
  std::lock_guard hold(dbLock_);
  if (!handle()) return std::nullopt;
  std::vector<TVXSearchSuggestion> found;
  const auto started = std::chrono::steady_clock::now();
  sqlite3_stmt* stmt = selectStatement(count);
  if (!stmt) return found;
  const std::string normalized = normalizeString(input);
  if (normalized.empty()) return found;
  const std::int64_t now = wholeSeconds(env_.clock->now());
  for (int i = 0; i < 5; ++i) sqlite3_bind_int(stmt, i + 1, static_cast<std::int32_t>(now - kBuckets[i]));
  sqlite3_bind_int(stmt, 6, static_cast<std::int32_t>(now));
  sqlite3_bind_text(stmt, 7, input.c_str(), -1, SQLITE_TRANSIENT);
  sqlite3_bind_text(stmt, 8, (input + kRangeEnd).c_str(), -1, SQLITE_TRANSIENT);
  sqlite3_bind_text(stmt, 9, normalized.c_str(), -1, SQLITE_TRANSIENT);
  sqlite3_bind_text(stmt, 10, (normalized + kRangeEnd).c_str(), -1, SQLITE_TRANSIENT);
  sqlite3_bind_int64(stmt, 11, static_cast<sqlite3_int64>(client));
  SearchDeadline limit{env_.clock, deadline ? *deadline : platform::TimePoint::max()};
  if (deadline) sqlite3_progress_handler(handle(), 256, &SearchDeadline::check, &limit);
  int rc;
  while ((rc = sqlite3_step(stmt)) == SQLITE_ROW) {
    TVXSearchSuggestion suggestion;
    const auto* text = reinterpret_cast<const char*>(sqlite3_column_text(stmt, 0));
    const auto* origin = reinterpret_cast<const char*>(sqlite3_column_text(stmt, 1));
    suggestion.suggestion = text ? text : "";
    const std::string_view originText = origin ? origin : "";
    suggestion.type = originText == "se" ? 1 : originText == "3d" ? 8 : 0;
    suggestion.score = sqlite3_column_double(stmt, 2);
    suggestion.query = input;
    if (eccLog().wants(platform::LogLevel::Debug)) {
      auto elapsed =
          std::chrono::duration_cast<std::chrono::milliseconds>(std::chrono::steady_clock::now() - started).count();
      eccLog().debug("Match found input {}, completion {}, score {:f} duration {}", input, suggestion.suggestion,
                     suggestion.score, elapsed);
    }
    found.push_back(std::move(suggestion));
  }
  if (deadline) sqlite3_progress_handler(handle(), 0, nullptr, nullptr);
  // Kept prepared for the next search; reset lets go of its read lock on the file.
  sqlite3_reset(stmt);
  if (rc == SQLITE_INTERRUPT) return std::nullopt;
  return found;
}

std::optional<std::vector<TVXSearchSuggestion>> EngagedCompletionCache::completionsForInput(const std::string& input,
                                                                                           unsigned long client,
                                                                                           unsigned long count,
                                                                                           unsigned long timeoutMs) {
  if (!cacheEnabled()) return std::nullopt;
  const platform::Duration timeout = platform::seconds(timeoutMs / 1000.0);
  auto answer = [&](std::optional<std::vector<TVXSearchSuggestion>> found, bool inTime)
      -> std::optional<std::vector<TVXSearchSuggestion>> {
    if (!inTime) {
      eccLog().debug("EngagedCompletionCache search timed out for input {} timeout value {}", input, timeoutMs);
      return std::nullopt;
    }
    if (!found) return std::nullopt;
    const double threshold = parameters().minThresholdToSend;
    std::erase_if(*found, [threshold](const TVXSearchSuggestion& s) { return s.score < threshold; });
    return found;
  };

  // The database is free: search here, on the caller's thread, held to the same deadline.
  if (std::unique_lock hold(dbLock_, std::try_to_lock); hold.owns_lock()) {
    if (!handle()) return std::nullopt;
    const platform::TimePoint deadline = env_.clock->now() + timeout;
    auto found = runSearch(input, client, count, &deadline);
    const bool inTime = found.has_value() && env_.clock->now() <= deadline;  // interrupted: nullopt
    return answer(std::move(found), inTime);
  }

  // Busy with a write or another search: the search waits for it on the pool, and the caller
  // waits for the search at most its time-out.
  struct Wait {
    std::mutex lock;
    std::condition_variable done;
    bool finished = false;
    std::optional<std::vector<TVXSearchSuggestion>> results;
  };
  auto wait = std::make_shared<Wait>();
  std::weak_ptr<EngagedCompletionCache> weak = weak_from_this();
  env_.pool->post([weak, wait, input, client, count] {
    std::optional<std::vector<TVXSearchSuggestion>> results;
    if (auto self = weak.lock()) results = self->runSearch(input, client, count);
    std::lock_guard<std::mutex> guard(wait->lock);
    wait->results = std::move(results);
    wait->finished = true;
    wait->done.notify_all();
  });

  std::unique_lock<std::mutex> guard(wait->lock);
  const bool inTime = env_.clock->waitFor(guard, wait->done, timeout, [&] { return wait->finished; });
  return answer(inTime ? std::move(wait->results) : std::nullopt, inTime);
}

std::optional<TVXSearchSuggestion> EngagedCompletionCache::completionForInput(const std::string& input,
                                                                             unsigned long client) {
  auto results = completionsForInput(input, client, 1);
  if (!results || results->empty()) return std::nullopt;
  return results->front();
}

void EngagedCompletionCache::featureCountsForInput(const std::string& input, unsigned long client,
                                                   std::function<void(std::map<std::string, std::int64_t>)> completion) {
  if (!cacheEnabled() || !hasDatabase()) return;
  std::weak_ptr<EngagedCompletionCache> weak = weak_from_this();
  env_.pool->post([weak, input, client, completion = std::move(completion)] {
    auto self = weak.lock();
    if (!self) return;
    std::map<std::string, std::int64_t> counts;
    std::unique_lock hold(self->dbLock_);
    sqlite3* db = self->handle();
    Statement s;
    const std::string sql = positional(kFeatureCountFormat);
    if (db && sqlite3_prepare_v2(db, sql.c_str(), -1, &s.stmt, nullptr) == SQLITE_OK) {
      const std::int64_t now = wholeSeconds(self->env_.clock->now());
      for (int i = 0; i < 5; ++i) sqlite3_bind_int(s.stmt, i + 1, static_cast<std::int32_t>(now - kBuckets[i]));
      const std::string normalized = normalizeString(input);
      sqlite3_bind_text(s.stmt, 6, input.c_str(), -1, SQLITE_TRANSIENT);
      sqlite3_bind_text(s.stmt, 7, (input + kRangeEnd).c_str(), -1, SQLITE_TRANSIENT);
      sqlite3_bind_text(s.stmt, 8, normalized.c_str(), -1, SQLITE_TRANSIENT);
      sqlite3_bind_text(s.stmt, 9, (normalized + kRangeEnd).c_str(), -1, SQLITE_TRANSIENT);
      sqlite3_bind_int64(s.stmt, 10, static_cast<sqlite3_int64>(client));
      while (sqlite3_step(s.stmt) == SQLITE_ROW) {
        const auto* letter = reinterpret_cast<const char*>(sqlite3_column_text(s.stmt, 0));
        counts[letter ? letter : ""] = sqlite3_column_int64(s.stmt, 1);
      }
    }
    sqlite3_finalize(s.stmt);
    s.stmt = nullptr;
    hold.unlock();
    if (completion) completion(std::move(counts));
  });
}

// Clearing

namespace {

bool runToDone(sqlite3* db, const std::string& sql) {
  Statement s;
  if (!db || sqlite3_prepare_v2(db, sql.c_str(), -1, &s.stmt, nullptr) != SQLITE_OK) return false;
  return sqlite3_step(s.stmt) == SQLITE_DONE;
}

void widenIfEqual(platform::TimePoint& from, platform::TimePoint& to) {
  if (from == to) {
    from -= platform::seconds(5);
    to += platform::seconds(5);
  }
}

}  // namespace

void EngagedCompletionCache::clearCompletionsFromDate(platform::TimePoint from, platform::TimePoint to,
                                                      unsigned long client) {
  std::lock_guard hold(dbLock_);
  sqlite3* db = handle();
  if (!db) return;
  widenIfEqual(from, to);
  const std::string sql = "DELETE FROM completion_cache_engagement WHERE engagement_date >= " + dateText(from) +
                          " AND engagement_date <= " + dateText(to) + " AND client == " + std::to_string(client) + ";";
  if (runToDone(db, sql)) {
    eccLog().debug("Cleared completions fromDate:{} toDate:{}", dateText(from), dateText(to));
  } else {
    eccLog().error("Failed to clear all completions");
  }
}

void EngagedCompletionCache::clearAllClientCompletionsFromDate(platform::TimePoint from, platform::TimePoint to) {
  std::lock_guard hold(dbLock_);
  sqlite3* db = handle();
  if (!db) return;
  widenIfEqual(from, to);
  const std::string sql = "DELETE FROM completion_cache_engagement WHERE engagement_date >= " + dateText(from) +
                          " AND engagement_date <= " + dateText(to) + ";";
  if (runToDone(db, sql)) {
    eccLog().debug("Cleared completions fromDate:{} toDate:{} for all clients", dateText(from), dateText(to));
  } else {
    eccLog().error("Failed to clearcompletions fromDate:{} toDate:{} for all clients", dateText(from), dateText(to));
  }
}

void EngagedCompletionCache::clearAllCompletionsForClient(unsigned long client) {
  std::lock_guard hold(dbLock_);
  sqlite3* db = handle();
  if (!db) return;
  if (runToDone(db,
                "DELETE FROM completion_cache_engagement WHERE client == " + std::to_string(client) + ";")) {
    eccLog().notice("Cleared completions for client {}", client);
  } else {
    eccLog().error("Failed to clear completions for client {}", client);
  }
}

void EngagedCompletionCache::clearAllCompletions() {
  std::lock_guard hold(dbLock_);
  sqlite3* db = handle();
  if (!db) return;
  if (runToDone(db, "DELETE FROM completion_cache_engagement;")) {
    eccLog().notice("Cleared all completions");
  } else {
    eccLog().error("Failed to clear all completions");
  }
}

void EngagedCompletionCache::seekaraDidClearSuggestions() {
  eccLog().notice("suggestions cleared notification received from Seekara, clearing EngagedCompletionCache");
  clearAllCompletions();
}

// Statistics

void EngagedCompletionCache::performCounterLogging() {
  std::lock_guard hold(dbLock_);
  if (!handle()) return;
  bool ok = false;
  std::int64_t entries = countRows("SELECT Count(*) FROM completion_cache_engagement;", &ok);
  if (!ok) {
    eccLog().error("Failed to get number of entries in engaged completion cache");
    entries = 0;
  }
  eccLog().debug("Number of completion in cache: {}", entries);
  if (entries >= 1) {
    std::int64_t value = significantValueFromString(std::to_string(entries));
    TavixDiagnosticDataReporter::setValue(value, kEntriesCounterKey);
    eccLog().debug("Counter logging {}: {}", kEntriesCounterKey, value);
  }
  std::error_code ec;
  auto size = platform::fs::file_size(databasePath_, ec);
  if (ec) {
    eccLog().error("Failed retrieving engaged completion cache db file size");
    return;
  }
  std::int64_t value = significantValueFromString(std::to_string(size));
  TavixDiagnosticDataReporter::setValue(value, kSizeCounterKey);
  eccLog().debug("Counter logging {}: {}", kSizeCounterKey, value);
}

}  // namespace tavix
