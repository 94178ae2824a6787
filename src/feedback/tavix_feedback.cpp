#include "feedback/tavix_feedback.h"

#include <google/protobuf/struct.pb.h>

#include <algorithm>
#include <cctype>
#include <cmath>

#include "core/diagnostics.h"
#include "feedback/feedback_json.h"
#include "feedback/vocabulary.h"
#include "platform/clock.h"

namespace tavix {

using google::protobuf::FieldDescriptor;
using google::protobuf::Message;

namespace {

// Oneof fields of the payload are numbered type + 10; from 200 on they hold records without a
// type of their own.
constexpr int kPayloadFieldOffset = 10;
constexpr int kFirstUntypedPayloadField = 200;

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

std::uint64_t hostTicksNow(const platform::Clock* clock) {
  if (!clock) return 0;
  const double seconds = platform::toUnixSeconds(clock->now());
  return seconds > 0 ? static_cast<std::uint64_t>(seconds * 1e9) : 0;
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
  if (!field || field->number() >= kFirstUntypedPayloadField) return kFeedbackTypeCodableFallback;
  return field->number() - kPayloadFieldOffset;
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

namespace {

nlohmann::json structValueToJson(const google::protobuf::Value& value);

// Whole numbers go out without a fraction, as the platform's JSON writer writes them: 4085, not
// 4085.0. Beyond 2^53 a double holds no exact integer any more and stays a double.
nlohmann::json number(double value) {
  if (std::trunc(value) == value && std::fabs(value) < 9007199254740992.0) return static_cast<std::int64_t>(value);
  return value;
}

nlohmann::json structToJson(const google::protobuf::Struct& object) {
  nlohmann::json out = nlohmann::json::object();
  for (const auto& [key, value] : object.fields()) out[key] = structValueToJson(value);
  return out;
}

nlohmann::json structValueToJson(const google::protobuf::Value& value) {
  switch (value.kind_case()) {
    case google::protobuf::Value::kNumberValue: return number(value.number_value());
    case google::protobuf::Value::kStringValue: return value.string_value();
    case google::protobuf::Value::kBoolValue: return value.bool_value();
    case google::protobuf::Value::kStructValue: return structToJson(value.struct_value());
    case google::protobuf::Value::kListValue: {
      nlohmann::json list = nlohmann::json::array();
      for (const auto& item : value.list_value().values()) list.push_back(structValueToJson(item));
      return list;
    }
    default: return nullptr;
  }
}

// One value of `field` (element `index` of a repeated field, or the field itself for -1).
nlohmann::json fieldValueToJson(const Message& message, const FieldDescriptor* field, int index) {
  const auto* r = message.GetReflection();
  const bool repeated = index >= 0;
  switch (field->cpp_type()) {
    case FieldDescriptor::CPPTYPE_INT32:
      return repeated ? r->GetRepeatedInt32(message, field, index) : r->GetInt32(message, field);
    case FieldDescriptor::CPPTYPE_INT64:
      return repeated ? r->GetRepeatedInt64(message, field, index) : r->GetInt64(message, field);
    case FieldDescriptor::CPPTYPE_UINT32:
      return repeated ? r->GetRepeatedUInt32(message, field, index) : r->GetUInt32(message, field);
    case FieldDescriptor::CPPTYPE_UINT64:
      return repeated ? r->GetRepeatedUInt64(message, field, index) : r->GetUInt64(message, field);
    case FieldDescriptor::CPPTYPE_DOUBLE:
      return number(repeated ? r->GetRepeatedDouble(message, field, index) : r->GetDouble(message, field));
    case FieldDescriptor::CPPTYPE_FLOAT:
      return number(repeated ? r->GetRepeatedFloat(message, field, index) : r->GetFloat(message, field));
    case FieldDescriptor::CPPTYPE_BOOL:
      return repeated ? r->GetRepeatedBool(message, field, index) : r->GetBool(message, field);
    case FieldDescriptor::CPPTYPE_STRING:
      return repeated ? r->GetRepeatedString(message, field, index) : r->GetString(message, field);
    case FieldDescriptor::CPPTYPE_ENUM: {
      const int number = repeated ? r->GetRepeatedEnumValue(message, field, index) : r->GetEnumValue(message, field);
      // The value's name is its wire string; a number this build does not know goes as it is.
      if (const auto* value = field->enum_type()->FindValueByNumber(number)) return value->name();
      return number;
    }
    case FieldDescriptor::CPPTYPE_MESSAGE:
      return messageToJson(repeated ? r->GetRepeatedMessage(message, field, index) : r->GetMessage(message, field));
  }
  return nullptr;
}

}  // namespace

nlohmann::json messageToJson(const Message& message) {
  if (const auto* object = dynamic_cast<const google::protobuf::Struct*>(&message)) return structToJson(*object);
  nlohmann::json out = nlohmann::json::object();
  const auto* r = message.GetReflection();
  std::vector<const FieldDescriptor*> fields;
  r->ListFields(message, &fields);  // only the fields that are set: defaults stay out
  for (const FieldDescriptor* field : fields) {
    if (field->is_map()) {
      nlohmann::json map = nlohmann::json::object();
      const FieldDescriptor* key = field->message_type()->map_key();
      const FieldDescriptor* value = field->message_type()->map_value();
      for (int i = 0; i < r->FieldSize(message, field); ++i) {
        const Message& entry = r->GetRepeatedMessage(message, field, i);
        const nlohmann::json k = fieldValueToJson(entry, key, -1);
        map[k.is_string() ? k.get<std::string>() : k.dump()] = fieldValueToJson(entry, value, -1);
      }
      out[field->name()] = std::move(map);
    } else if (field->is_repeated()) {
      nlohmann::json list = nlohmann::json::array();
      for (int i = 0; i < r->FieldSize(message, field); ++i) list.push_back(fieldValueToJson(message, field, i));
      out[field->name()] = std::move(list);
    } else {
      out[field->name()] = fieldValueToJson(message, field, -1);
    }
  }
  return out;
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
