#include "devserver/resource_files.h"

#include <map>

namespace tavix::devserver {

namespace {

using json = nlohmann::json;

struct Entry {
  const char* identifier;
  const char* path;     // under the base URL
  const char* version;  // the "version" query item and ETag; empty for the hints, versioned by path
};

constexpr Entry kEntries[] = {
    {"dictionary_resources_url", "/resources/dictionary_resources_url", "3"},
    {"installed_app_whitelist", "/resources/installed_app_whitelist", "0a1f"},
    {"lookup_hints_weekly", "/resources/lookup_hints_weekly", ""},
    {"lookup_hints_monthly", "/resources/lookup_hints_monthly", ""},
};

std::string whitelist() {
  // Each app's list ends with the object that gives its bit in the bitmap.
  const json inner = {{"version", "0a1f"},
                      {"apps",
                       {{"org.gnome.Nautilus", {{{"encoding_id", 1}}}},
                        {"firefox-esr", {"esr", {{"encoding_id", 3}}}},
                        {"org.gnome.Calculator", {{{"encoding_id", 5}}}},
                        {"org.libreoffice.LibreOffice.writer", {{{"encoding_id", 8}}}},
                        {"org.gnome.Maps", {{{"encoding_id", 13}}}}}}};
  return json{{"apps", inner.dump()}, {"compression", "RLE"}, {"encoding", "bitmap"}}.dump(2) + "\n";
}

std::string hints(const char* period, const json& terms) {
  json entries = json::array();
  for (const auto& [term, domain] : terms.items()) entries.push_back({{"term", term}, {"domain", domain}});
  return json{{"period", period}, {"hints", entries}}.dump(2) + "\n";
}

const std::map<std::string, ResourceFile>& files() {
  static const std::map<std::string, ResourceFile> table = {
      {"/resources/dictionary_resources_url", {json::array({"wn", "gcide", "moby-thesaurus"}).dump() + "\n", "3"}},
      {"/resources/installed_app_whitelist", {whitelist(), "0a1f"}},
      // The hints live where their period says and are versioned by it: the daemon follows the
      // redirect and reads "2026-47-weekly" from the path it lands on.
      {"/resources/lookup_hints_weekly", {"", "", "/resources/weekly/2026/47/hints"}},
      {"/resources/lookup_hints_monthly", {"", "", "/resources/monthly/2026/11/hints"}},
      {"/resources/weekly/2026/47/hints",
       {hints("weekly", {{"aurora borealis", "science"}, {"solstice", "astronomy"}, {"croissant", "food"}}),
        "2026-47-weekly"}},
      {"/resources/monthly/2026/11/hints",
       {hints("monthly", {{"mitochondria", "biology"}, {"sonnet", "literature"}}), "2026-11-monthly"}},
  };
  return table;
}

}  // namespace

void addResourcesToBag(json& bag, const std::string& base, const std::string& key) {
  json list = json::array();
  for (const auto& entry : kEntries) {
    std::string url = base + entry.path + "?";
    if (*entry.version) url += "version=" + std::string(entry.version) + "&";
    bag[entry.identifier] = url + "key=" + key;
    list.push_back(entry.identifier);
  }
  bag["download_resources_list"] = list;
}

std::optional<ResourceFile> resourceFile(const std::string& path) {
  const auto it = files().find(path);
  if (it == files().end()) return std::nullopt;
  return it->second;
}

}  // namespace tavix::devserver
