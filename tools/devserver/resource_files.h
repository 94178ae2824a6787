// The resource files the devserver's bag names: the known-dictionaries list, the installed-app
// whitelist and the weekly and monthly look-up hints, small but in the form the daemon reads.
//
// Each bag names them with a "key" query item that changes with every bag served (a rotation
// alone must not make the daemon download anything), and the versioned ones with a "version" item
// that is also their ETag, so that a daemon that holds the version gets 304.
#pragma once

#include <nlohmann/json.hpp>
#include <optional>
#include <string>

namespace tavix::devserver {

struct ResourceFile {
  std::string body;
  std::string etag;  // without quotes
  std::string redirect;  // a path: the file is there instead (302)
};

// Adds "download_resources_list" and each resource's URL (under `base`, with `key`) to `bag`.
void addResourcesToBag(nlohmann::json& bag, const std::string& base, const std::string& key);

// The file served at `path` ("/resources/..."), or none when the bag names no such file.
std::optional<ResourceFile> resourceFile(const std::string& path);

}  // namespace tavix::devserver
