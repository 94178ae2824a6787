// Makes one session's events safe to upload: every result and suggestion identifier is replaced
// by a session-local number ("1", "2", ...), and objects that events only referred to (engaged,
// listed as visible) without ever carrying them in full (ranking events) are collected so the
// session can send them once in full. Referring events keep only the identifier of an object.
//
// One helper per session upload; not thread-safe (used on one queue at a time).
#pragma once

#include <cstdint>
#include <map>
#include <optional>
#include <set>
#include <string>
#include <vector>

#include "tavix_proto/feedback_records.pb.h"

namespace tavix {

class SessionProcessingHelper {
 public:
  SessionProcessingHelper() = default;

  // Replaces the identifiers of the objects `codable` carries (in place) and notes whether it
  // carries them in full; in an event that only refers to them, an object with an identifier is
  // cut down to it. Null is ignored.
  void process(google::protobuf::Message* codable);

  // None for an empty identifier; the same number for an identifier seen before; else the next.
  std::optional<std::string> replacementForIdentifier(const std::string& identifier);

  // Objects referenced but never seen in full, in the order they were first referenced.
  std::vector<proto::CTSearchResultForFeedback> missingResults() const;
  std::vector<proto::CTSearchSuggestionForFeedback> missingSuggestions() const;

 private:
  void didReference(const google::protobuf::Message& object, const std::string& id);
  void didExpand(const std::string& id);

  std::int32_t nextMappedId_ = 1;
  std::map<std::string, std::string> idMapping_;
  std::vector<std::string> referenceOrder_;
  std::map<std::string, proto::CTSearchResultForFeedback> referencedResults_;
  std::map<std::string, proto::CTSearchSuggestionForFeedback> referencedSuggestions_;
  std::set<std::string> expandedIdSet_;
};

}  // namespace tavix
