#include "feedback/session_processing_helper.h"

#include <algorithm>

namespace tavix {

using google::protobuf::Message;

namespace {

template <typename Repeated>
void addAll(Repeated* objects, std::vector<Message*>* out) {
  for (auto& object : *objects) out->push_back(&object);
}

std::string* identifierOf(Message* object) {
  if (auto* result = dynamic_cast<proto::CTSearchResultForFeedback*>(object)) return result->mutable_id();
  if (auto* suggestion = dynamic_cast<proto::CTSearchSuggestionForFeedback*>(object)) return suggestion->mutable_id();
  return nullptr;
}

}  // namespace

std::optional<std::string> SessionProcessingHelper::replacementForIdentifier(const std::string& identifier) {
  if (identifier.empty()) return std::nullopt;
  if (auto it = idMapping_.find(identifier); it != idMapping_.end()) return it->second;
  std::string replacement = std::to_string(nextMappedId_++);
  idMapping_.emplace(identifier, replacement);
  return replacement;
}

void SessionProcessingHelper::process(Message* codable) {
  if (!codable) return;
  std::vector<Message*> objects;
  bool expanded = false;
  if (auto* visible = dynamic_cast<proto::CTVisibleResultsFeedback*>(codable)) {
    addAll(visible->mutable_results(), &objects);
  }
  if (auto* suggestions = dynamic_cast<proto::CTVisibleSuggestionsFeedback*>(codable)) {
    addAll(suggestions->mutable_suggestions(), &objects);
    expanded = true;
  } else {
    expanded = false;
  }
  if (auto* engagement = dynamic_cast<proto::CTSuggestionEngagementFeedback*>(codable)) {
    if (engagement->has_suggestion()) objects.push_back(engagement->mutable_suggestion());
  }
  if (auto* late = dynamic_cast<proto::CTResultsReceivedAfterTimeoutFeedback*>(codable)) {
    addAll(late->mutable_results(), &objects);
    expanded = true;
  }
  if (auto* sectionRanking = dynamic_cast<proto::CTSectionRankingFeedback*>(codable)) {
    for (auto& ranking : *sectionRanking->mutable_results()) process(&ranking);
    addAll(sectionRanking->mutable_section()->mutable_results(), &objects);
    expanded = true;
  }
  if (auto* resultRanking = dynamic_cast<proto::CTResultRankingFeedback*>(codable)) {
    addAll(resultRanking->mutable_duplicate_results(), &objects);
    addAll(resultRanking->mutable_hidden_results(), &objects);
    if (resultRanking->has_result()) objects.push_back(resultRanking->mutable_result());
    expanded = true;
  }
  if (auto* ranking = dynamic_cast<proto::CTRankingFeedback*>(codable)) {
    for (auto& section : *ranking->mutable_sections()) process(&section);
  }
  if (auto* engagement = dynamic_cast<proto::CTResultEngagementFeedback*>(codable)) {
    if (engagement->has_result()) objects.push_back(engagement->mutable_result());
  }
  if (auto* grading = dynamic_cast<proto::CTResultGradingFeedback*>(codable)) {
    if (grading->has_result()) objects.push_back(grading->mutable_result());
  }
  if (auto* late = dynamic_cast<proto::CTLateSectionsAppendedFeedback*>(codable)) {
    for (auto& section : *late->mutable_sections()) addAll(section.mutable_results(), &objects);
    expanded = true;
  }
  if (auto* section = dynamic_cast<proto::CTSectionEngagementFeedback*>(codable)) {
    addAll(section->mutable_section()->mutable_results(), &objects);
  }

  for (Message* object : objects) {
    std::string* id = identifierOf(object);
    const std::optional<std::string> replacement = replacementForIdentifier(*id);
    *id = replacement.value_or(std::string());
    if (expanded) {
      didExpand(*id);
    } else {
      didReference(*object, *id);
      // A reference is its identifier: the object goes in full once per session, in the event
      // that carries it whole or among the missing ones. One without an identifier stays whole.
      if (!id->empty()) {
        const std::string kept = *id;
        object->Clear();
        *identifierOf(object) = kept;
      }
    }
  }
}

void SessionProcessingHelper::didReference(const Message& object, const std::string& id) {
  if (id.empty() || expandedIdSet_.count(id)) return;
  if (referencedResults_.count(id) || referencedSuggestions_.count(id)) return;  // the first wins
  if (auto* result = dynamic_cast<const proto::CTSearchResultForFeedback*>(&object)) {
    referencedResults_.emplace(id, *result);
  } else if (auto* suggestion = dynamic_cast<const proto::CTSearchSuggestionForFeedback*>(&object)) {
    referencedSuggestions_.emplace(id, *suggestion);
  }
  referenceOrder_.push_back(id);
}

void SessionProcessingHelper::didExpand(const std::string& id) {
  if (id.empty()) return;
  expandedIdSet_.insert(id);
  referencedResults_.erase(id);
  referencedSuggestions_.erase(id);
  std::erase(referenceOrder_, id);
}

std::vector<proto::CTSearchResultForFeedback> SessionProcessingHelper::missingResults() const {
  std::vector<proto::CTSearchResultForFeedback> out;
  for (const auto& id : referenceOrder_) {
    if (auto it = referencedResults_.find(id); it != referencedResults_.end()) out.push_back(it->second);
  }
  return out;
}

std::vector<proto::CTSearchSuggestionForFeedback> SessionProcessingHelper::missingSuggestions() const {
  std::vector<proto::CTSearchSuggestionForFeedback> out;
  for (const auto& id : referenceOrder_) {
    if (auto it = referencedSuggestions_.find(id); it != referencedSuggestions_.end()) out.push_back(it->second);
  }
  return out;
}

}  // namespace tavix
