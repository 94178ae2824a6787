// JSON helpers shared by the feedback sources. Private to src/feedback: include from .cpp only.
#pragma once

#include <nlohmann/json.hpp>

#include "feedback/tavix_feedback.h"

namespace tavix::feedback_json {

// A message's fields under their proto names, defaults included; null when it cannot be encoded.
nlohmann::json messageToJson(const google::protobuf::Message& message);

// The dictionary form with "timestamp" = `timestamp`; an empty object when there is no event,
// null when the event cannot be encoded.
nlohmann::json dictionaryObject(const proto::CTTavixFeedback& feedback, std::uint64_t timestamp);

}  // namespace tavix::feedback_json
