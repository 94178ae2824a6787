#include "platform/http/transfer_journal.h"

#include <algorithm>

#include "platform/json_value.h"
#include "platform/log.h"

namespace tavix::platform::http {

namespace {

using Array = PropertyValue::Array;

constexpr const char* kTaskSuffix = ".task";
constexpr const char* kBodySuffix = ".body";

// Keys of the request itself; every other key of a task file is one of the session's values.
constexpr const char* kRequestKeys[] = {"url", "method", "headers", "timeout"};

std::string encode(const URLRequest& request, const Dictionary& values) {
  Dictionary out = values;
  Array headers;
  for (const auto& [name, value] : request.headers.all()) headers.push_back(Array{name, value});
  out["url"] = request.url;
  out["method"] = request.method;
  out["headers"] = std::move(headers);
  out["timeout"] = request.timeoutInterval;
  return toJson(out);
}

bool decode(const std::string& text, URLRequest* request, Dictionary* values) {
  auto parsed = parseJson(text);
  const Dictionary* in = parsed ? parsed->dictionary() : nullptr;
  if (!in) return false;
  const auto url = in->find("url");
  if (url == in->end() || !url->second.string()) return false;
  request->url = *url->second.string();
  if (auto it = in->find("method"); it != in->end() && it->second.string()) request->method = *it->second.string();
  if (auto it = in->find("timeout"); it != in->end() && it->second.asReal()) request->timeoutInterval = *it->second.asReal();
  if (auto it = in->find("headers"); it != in->end() && it->second.array()) {
    for (const auto& field : *it->second.array()) {
      const Array* pair = field.array();
      if (pair && pair->size() == 2 && (*pair)[0].string() && (*pair)[1].string()) {
        request->headers.add(*(*pair)[0].string(), *(*pair)[1].string());
      }
    }
  }
  for (const auto& [key, value] : *in) {
    if (std::find(std::begin(kRequestKeys), std::end(kRequestKeys), key) == std::end(kRequestKeys)) {
      (*values)[key] = value;
    }
  }
  return true;
}

}  // namespace

TransferJournal::TransferJournal(fs::path directory, std::string prefix, Logger& logger)
    : directory_(std::move(directory)), prefix_(std::move(prefix)), logger_(logger) {
  if (auto ec = createDirectory(directory_, true, 0700)) {
    logger_.error("cannot create the transfer journal {}: {}", directory_.string(), ec.message());
  }
  // What a crash left half-written: a body whose task never followed, the temporary file of an
  // atomic write. Neither would ever be sent or removed.
  std::error_code ec;
  std::vector<fs::path> orphans;
  for (const auto& item : fs::directory_iterator(directory_, ec)) {
    const auto& path = item.path();
    const bool temporary = path.filename().string().rfind('.', 0) == 0;
    const bool lonelyBody =
        path.extension() == kBodySuffix && !fs::exists(directory_ / (path.stem().string() + kTaskSuffix));
    if (temporary || lonelyBody) {
      orphans.push_back(path);
      continue;
    }
    next_ = std::max(next_, number(path.stem().string()) + 1);
  }
  for (const auto& orphan : orphans) {
    logger_.notice("removing orphan journal file {}", orphan.filename().string());
    fs::remove(orphan, ec);
  }
}

std::uint64_t TransferJournal::number(const std::string& name) const {
  const std::string head = prefix_ + ".";
  if (name.rfind(head, 0) != 0) return 0;
  try {
    return std::stoull(name.substr(head.size()));
  } catch (...) {
    return 0;
  }
}

std::optional<std::string> TransferJournal::add(const URLRequest& request, const Dictionary& values,
                                                const std::optional<std::string>& body) {
  const std::string name = prefix_ + "." + std::to_string(next_++);
  std::error_code ec;
  if (body) ec = writeFileAtomically(directory_ / (name + kBodySuffix), *body, 0600);
  if (!ec) ec = writeFileAtomically(directory_ / (name + kTaskSuffix), encode(request, values), 0600);
  if (ec) {
    logger_.error("cannot journal {}: {}", name, ec.message());
    remove(name);
    return std::nullopt;
  }
  return name;
}

bool TransferJournal::update(const std::string& name, const URLRequest& request, const Dictionary& values) {
  if (auto ec = writeFileAtomically(directory_ / (name + kTaskSuffix), encode(request, values), 0600)) {
    logger_.error("cannot update journal entry {}: {}", name, ec.message());
    return false;
  }
  return true;
}

void TransferJournal::remove(const std::string& name) {
  std::error_code ec;
  fs::remove(directory_ / (name + kTaskSuffix), ec);
  fs::remove(directory_ / (name + kBodySuffix), ec);
}

std::vector<TransferJournal::Record> TransferJournal::load() {
  std::error_code ec;
  std::vector<std::string> names;
  for (const auto& item : fs::directory_iterator(directory_, ec)) {
    if (item.path().extension() == kTaskSuffix) names.push_back(item.path().stem().string());
  }
  std::sort(names.begin(), names.end(), [this](const auto& a, const auto& b) { return number(a) < number(b); });
  std::vector<Record> records;
  for (const auto& name : names) {
    Record record;
    record.name = name;
    std::string text;
    bool ok = !readFile(directory_ / (name + kTaskSuffix), &text) && decode(text, &record.request, &record.values);
    if (ok && fs::exists(directory_ / (name + kBodySuffix), ec)) {
      record.body.emplace();
      ok = !readFile(directory_ / (name + kBodySuffix), &*record.body);
    }
    if (!ok) {
      logger_.error("unreadable journal entry {}, dropped", name);
      remove(name);
      continue;
    }
    records.push_back(std::move(record));
  }
  return records;
}

}  // namespace tavix::platform::http
