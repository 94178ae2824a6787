// JSON helpers shared by the feedback sources. Private to src/feedback: include from .cpp only.
#pragma once

#include <nlohmann/json.hpp>

#include "feedback/tavix_feedback.h"

namespace tavix::feedback_json {

// The fields of a message that are set, under their proto names: numbers as numbers, enumerated
// values by name, maps as objects; fields at their default are left out.
nlohmann::json messageToJson(const google::protobuf::Message& message);

// The dictionary form with "timestamp" = `timestamp`; an empty object when there is no event,
// null when the event cannot be encoded.
nlohmann::json dictionaryObject(const proto::CTTavixFeedback& feedback, std::uint64_t timestamp);

}  // namespace tavix::feedback_json
