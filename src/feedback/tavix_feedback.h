// CTTavixFeedback: the wrapper of one feedback event on its way through a session. The record
// itself is the protobuf message tavix::proto::CTTavixFeedback (payload with type and event,
// query id, user GUID, user agent, relative time stamp); this header adds its operations.
//
// An event record (any CT…Feedback message of feedback_records.proto) is a "codable". Codables
// carry their own time in host ticks (nanoseconds) in field 1 "timestamp".
//
// Events are shared by reference (FeedbackRef) between the manager, sessions and storage. A
// record is mutated only by the queue that owns its session. Functions here are pure otherwise.
#pragma once

#include <cstdint>
#include <memory>
#include <string>
#include <vector>

#include "tavix_proto/feedback_session.pb.h"

namespace tavix {

namespace platform {
class Clock;
}

using FeedbackRef = std::shared_ptr<proto::CTTavixFeedback>;

// Wraps a client's payload as it came (its `type` is kept). `userGuid` is stored upper-cased.
FeedbackRef makeTavixFeedback(proto::CTFeedbackPayload payload, std::int64_t queryId, const std::string& userGuid,
                              const std::string& userAgent);
// Wraps an event record the daemon made itself; the payload type is the record's own type
// (codableType). A message that is not an event record gives a payload with type 21 and no event.
FeedbackRef makeTavixFeedbackWithCodable(const google::protobuf::Message& codable, std::int64_t queryId,
                                         const std::string& userGuid, const std::string& userAgent);

// The payload's numeric type.
int feedbackType(const proto::CTTavixFeedback& feedback);
// The event record inside the payload, or null when the payload carries none.
const google::protobuf::Message* feedbackCodable(const proto::CTFeedbackPayload& payload);
google::protobuf::Message* mutableFeedbackCodable(proto::CTFeedbackPayload* payload);

// What every codable answers: its time stamp (0 when it has none), its type (21 for a message
// that is not an event record) and whether its dictionary carries "query_id" (false only for the
// session-level records: session end, missing results/suggestions, connection invalidated).
std::uint64_t codableTimestamp(const google::protobuf::Message* codable);
int codableType(const google::protobuf::Message& codable);
bool codableRequiresQueryId(const google::protobuf::Message* codable);

// Host ticks (nanoseconds) to whole milliseconds.
inline std::uint64_t hostTicksToMilliseconds(std::uint64_t ticks) { return ticks / 1000000u; }
// The time stamp of a record the daemon makes now: the clock's time in nanoseconds since 1970, so
// that the daemon's records and sessions agree, also on a virtual clock. 0 without a clock.
std::uint64_t hostTicksNow(const platform::Clock* clock);

// The dictionary form as compact JSON text: the codable's fields under their JSON names,
// "query_id" when the codable requires it, "type" by name and "timestamp" = rel_timestamp.
// Empty when the payload carries no event or it cannot be encoded.
std::string feedbackDictionary(const proto::CTTavixFeedback& feedback);
// The same with "timestamp" = the codable's own time in milliseconds. Empty when the JSON cannot
// be produced; then one is added to "com.norvel.tavixd.feedbacknotsent".
std::string feedbackDescription(const proto::CTTavixFeedback& feedback);

// Orders by the codables' time stamps: -1 when a is older (ascending), 0 when equal, 1 when a is
// newer (descending).
int timeStampComparator(const proto::CTTavixFeedback& a, const proto::CTTavixFeedback& b);
// Sorts oldest first with timeStampComparator; equal time stamps keep no defined order.
void sortByTimeStamp(std::vector<FeedbackRef>& events);

}  // namespace tavix
