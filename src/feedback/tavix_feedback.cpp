#include "feedback/tavix_feedback.h"

#include <google/protobuf/util/json_util.h>

#include <algorithm>
#include <cctype>

#include "core/diagnostics.h"
#include "feedback/feedback_json.h"
#include "feedback/vocabulary.h"

namespace tavix {

using google::protobuf::FieldDescriptor;
using google::protobuf::Message;

namespace {

// Oneof fields of the payload are numbered type + 10.
constexpr int kPayloadFieldOffset = 10;

const FieldDescriptor* payloadFieldFor(const google::protobuf::Descriptor* codable) {
  const auto* payload = proto::CTFeedbackPayload::descriptor();
  const auto* oneof = payload->FindOneofByName("event");
  for (int i = 0; i < oneof->field_count(); ++i) {
    if (oneof->field(i)->message_type() == codable) return oneof->field(i);
  }
  return nullptr;
}

std::string upper(std::string text) {
  std::transform(text.begin(), text.end(), text.begin(), [](unsigned char c) { return std::toupper(c); });
  return text;
}

}  // namespace

FeedbackRef makeTavixFeedback(proto::CTFeedbackPayload payload, std::int64_t queryId, const std::string& userGuid,
                              const std::string& userAgent) {
  auto feedback = std::make_shared<proto::CTTavixFeedback>();
  *feedback->mutable_payload() = std::move(payload);
  feedback->set_query_id(queryId);
  feedback->set_user_guid(upper(userGuid));
  feedback->set_user_agent(userAgent);
  return feedback;
}

FeedbackRef makeTavixFeedbackWithCodable(const Message& codable, std::int64_t queryId, const std::string& userGuid,
                                         const std::string& userAgent) {
  proto::CTFeedbackPayload payload;
  payload.set_type(codableType(codable));
  if (const FieldDescriptor* field = payloadFieldFor(codable.GetDescriptor())) {
    payload.GetReflection()->MutableMessage(&payload, field)->CopyFrom(codable);
  }
  return makeTavixFeedback(std::move(payload), queryId, userGuid, userAgent);
}

int feedbackType(const proto::CTTavixFeedback& feedback) { return feedback.payload().type(); }

const Message* feedbackCodable(const proto::CTFeedbackPayload& payload) {
  const auto* oneof = payload.GetDescriptor()->FindOneofByName("event");
  const FieldDescriptor* field = payload.GetReflection()->GetOneofFieldDescriptor(payload, oneof);
  return field ? &payload.GetReflection()->GetMessage(payload, field) : nullptr;
}

Message* mutableFeedbackCodable(proto::CTFeedbackPayload* payload) {
  const auto* oneof = payload->GetDescriptor()->FindOneofByName("event");
  const FieldDescriptor* field = payload->GetReflection()->GetOneofFieldDescriptor(*payload, oneof);
  return field ? payload->GetReflection()->MutableMessage(payload, field) : nullptr;
}

std::uint64_t codableTimestamp(const Message* codable) {
  if (!codable) return 0;
  const FieldDescriptor* field = codable->GetDescriptor()->FindFieldByName("timestamp");
  if (!field || field->cpp_type() != FieldDescriptor::CPPTYPE_UINT64 || field->is_repeated()) return 0;
  return codable->GetReflection()->GetUInt64(*codable, field);
}

int codableType(const Message& codable) {
  const FieldDescriptor* field = payloadFieldFor(codable.GetDescriptor());
  return field ? field->number() - kPayloadFieldOffset : kFeedbackTypeCodableFallback;
}

bool codableRequiresQueryId(const Message* codable) {
  if (!codable) return true;
  switch (codableType(*codable)) {
    case kFeedbackTypeSessionEnd:
    case kFeedbackTypeSessionMissingResults:
    case kFeedbackTypeSessionMissingSuggestions:
    case kFeedbackTypeConnectionInvalidated:
      return false;
    default:
      return true;
  }
}

namespace feedback_json {

nlohmann::json messageToJson(const Message& message) {
  google::protobuf::util::JsonPrintOptions options;
  options.preserve_proto_field_names = true;
  options.always_print_primitive_fields = true;
  std::string text;
  if (!google::protobuf::util::MessageToJsonString(message, &text, options).ok()) return nullptr;
  auto parsed = nlohmann::json::parse(text, nullptr, /*allow_exceptions=*/false);
  return parsed.is_discarded() ? nlohmann::json(nullptr) : parsed;
}

nlohmann::json dictionaryObject(const proto::CTTavixFeedback& feedback, std::uint64_t timestamp) {
  const Message* codable = feedbackCodable(feedback.payload());
  if (!codable) return nlohmann::json::object();
  nlohmann::json dictionary = messageToJson(*codable);
  if (!dictionary.is_object()) return nullptr;
  if (codableRequiresQueryId(codable)) dictionary[TavixFeedbackQueryId] = feedback.query_id();
  dictionary[TavixFeedbackType] = feedbackTypeName(feedbackType(feedback));
  dictionary[TavixFeedbackTimestamp] = timestamp;
  return dictionary;
}

}  // namespace feedback_json

std::string feedbackDictionary(const proto::CTTavixFeedback& feedback) {
  nlohmann::json dictionary = feedback_json::dictionaryObject(feedback, feedback.rel_timestamp());
  if (!dictionary.is_object() || dictionary.empty()) return {};
  return dictionary.dump(-1, ' ', false, nlohmann::json::error_handler_t::replace);
}

std::string feedbackDescription(const proto::CTTavixFeedback& feedback) {
  const std::uint64_t ms = hostTicksToMilliseconds(codableTimestamp(feedbackCodable(feedback.payload())));
  nlohmann::json dictionary = feedback_json::dictionaryObject(feedback, ms);
  if (dictionary.is_object() && dictionary.empty()) return {};  // no event to describe
  try {
    if (dictionary.is_null()) throw std::runtime_error("event record has no JSON form");
    return dictionary.dump();
  } catch (const std::exception&) {
    TavixDiagnosticDataReporter::addValue(1, TavixFeedbackEventsDroppedCounterKey);
    return {};
  }
}

int timeStampComparator(const proto::CTTavixFeedback& a, const proto::CTTavixFeedback& b) {
  const std::uint64_t ta = codableTimestamp(feedbackCodable(a.payload()));
  const std::uint64_t tb = codableTimestamp(feedbackCodable(b.payload()));
  if (ta == tb) return 0;
  return ta > tb ? 1 : -1;
}

void sortByTimeStamp(std::vector<FeedbackRef>& events) {
  std::sort(events.begin(), events.end(),
            [](const FeedbackRef& a, const FeedbackRef& b) { return timeStampComparator(*a, *b) < 0; });
}

}  // namespace tavix
