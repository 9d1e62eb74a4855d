#include "cohorts/usage_model.h"

#include "cohorts/managed_object_context.h"
#include "cohorts/usage_store.h"
#include "util/lock.h"

#include <limits>

namespace fbf {
namespace {

std::vector<AttributeDescription> counters(std::initializer_list<std::string_view> names) {
  std::vector<AttributeDescription> attributes{{"timestamp", AttributeType::date}};
  for (auto n : names) attributes.push_back({n, AttributeType::integer16});
  return attributes;
}

}  // namespace

std::optional<FlushFrequency> flushFrequencyFromRawValue(int64_t raw) {
  if (raw < 0 || raw > 2) return std::nullopt;
  return static_cast<FlushFrequency>(raw);
}

std::optional<size_t> EntityDescription::attributeIndex(std::string_view attribute) const {
  for (size_t i = 0; i < attributes.size(); ++i) {
    if (attributes[i].name == attribute) return i;
  }
  return std::nullopt;
}

std::optional<size_t> EntityDescription::relationshipIndex(std::string_view relationship) const {
  for (size_t i = 0; i < relationships.size(); ++i) {
    if (relationships[i].name == relationship) return i;
  }
  return std::nullopt;
}

const std::vector<EntityDescription>& cohortsObjectModel() {
  static const std::vector<EntityDescription> model = {
      {"VIRUsageEvent", {{"timestamp", AttributeType::date}}, {{"usageCategory", "VIRCategory", true}}},
      {"VIRCategory", {{"clientIntVal", AttributeType::integer}}, {{"usageEvent", "VIRUsageEvent", false}}},
      {"VIRFlushEvent", {{"timestamp", AttributeType::date}, {"type", AttributeType::integer}}, {}},
      {"VIRScoutlumeSession",
       counters({"appLaunch", "onDeviceAddressBookData", "onDeviceOtherPersonalData", "punchout",
                 "thirdPartyInAppContent", "vireon", "querySuggestion", "vexaSuggestions", "other"}),
       {}},
      {"VIRWayfinSession",
       counters({"goToSite", "localGoto", "localTap", "vireonGoto", "vireonTap", "thirdPartyCompletionOrRecentSearch",
                 "thirdPartyGoto", "thirdPartyTap", "other"}),
       {}},
      {"VIRImagesSession", counters({"image", "querySuggestion", "recentResult", "zkw", "other"}), {}},
  };
  return model;
}

const EntityDescription* entityNamed(std::string_view name) {
  for (const auto& e : cohortsObjectModel()) {
    if (e.name == name) return &e;
  }
  return nullptr;
}

// --- ManagedObject ----------------------------------------------------------

ManagedObject::ManagedObject(const EntityDescription& entity)
    : entity_(&entity), values_(entity.attributes.size()), relationships_(entity.relationships.size()) {
  // Counters start at zero rather than absent, as their columns do.
  for (size_t i = 0; i < entity.attributes.size(); ++i) {
    if (entity.attributes[i].type == AttributeType::integer16) values_[i] = int64_t{0};
  }
}

void ManagedObject::setValue(size_t attribute, AttributeValue value) {
  values_.at(attribute) = std::move(value);
  didChange();
}

std::shared_ptr<ManagedObject> ManagedObject::related(size_t relationship) const {
  auto& slot = relationships_.at(relationship);
  if (slot.strong) return slot.strong;
  if (auto alive = slot.weak.lock()) return alive;
  if (slot.unresolvedRowid == 0) return nullptr;
  auto context = context_.lock();
  if (!context) return nullptr;
  const auto* destination = entityNamed(entity_->relationships[relationship].destination);
  auto object = destination ? context->existingObject(*destination, slot.unresolvedRowid) : nullptr;
  if (object) {
    if (entity_->relationships[relationship].owning) {
      slot.strong = object;
    } else {
      slot.weak = object;
    }
  }
  return object;
}

void ManagedObject::setRelated(size_t relationship, const std::shared_ptr<ManagedObject>& destination) {
  auto& slot = relationships_.at(relationship);
  slot = RelationshipSlot{};
  if (entity_->relationships[relationship].owning) {
    slot.strong = destination;
  } else {
    slot.weak = destination;
  }
  didChange();
}

std::optional<SystemTime> ManagedObject::dateAttribute(size_t attribute) const {
  if (const auto* d = std::get_if<double>(&values_.at(attribute))) return timeFromStoredSeconds(*d);
  if (const auto* i = std::get_if<int64_t>(&values_.at(attribute))) return timeFromStoredSeconds(static_cast<double>(*i));
  return std::nullopt;
}

void ManagedObject::setDateAttribute(size_t attribute, SystemTime date) { setValue(attribute, secondsSinceEpoch(date)); }

int64_t ManagedObject::integerAttribute(size_t attribute) const {
  if (const auto* i = std::get_if<int64_t>(&values_.at(attribute))) return *i;
  // A damaged store can hold any real; converting one beyond int64 is undefined.
  if (const auto* d = std::get_if<double>(&values_.at(attribute))) {
    return *d > -9.2e18 && *d < 9.2e18 ? static_cast<int64_t>(*d) : 0;
  }
  return 0;
}

void ManagedObject::didChange() {
  if (auto context = context_.lock()) context->didChange(shared_from_this());
}

// --- Typed records ----------------------------------------------------------

VIRUsageEvent::VIRUsageEvent() : ManagedObject(*entityNamed(kEntityName)) {}

std::shared_ptr<VIRCategory> VIRUsageEvent::usageCategory() const {
  return std::dynamic_pointer_cast<VIRCategory>(related(0));
}
void VIRUsageEvent::setUsageCategory(const std::shared_ptr<VIRCategory>& category) { setRelated(0, category); }

VIRCategory::VIRCategory() : ManagedObject(*entityNamed(kEntityName)) {}

std::shared_ptr<VIRUsageEvent> VIRCategory::usageEvent() const {
  return std::dynamic_pointer_cast<VIRUsageEvent>(related(0));
}
void VIRCategory::setUsageEvent(const std::shared_ptr<VIRUsageEvent>& event) { setRelated(0, event); }

VIRFlushEvent::VIRFlushEvent() : ManagedObject(*entityNamed(kEntityName)) {}

std::shared_ptr<VIRFlushEvent> VIRFlushEvent::createFlushEvent(EventFactoryProtocol& factory, SystemTime timestamp,
                                                               FlushFrequency type) {
  auto event = factory.createFlushEvent();
  if (!event) return nullptr;
  event->setTimestamp(timestamp);
  event->setType(rawValue(type));
  return event;
}

int16_t PropensitySession::counter(size_t counter) const {
  return static_cast<int16_t>(integerAttribute(counter + 1));
}

void PropensitySession::incrementCounter(size_t counter) {
  int64_t current = integerAttribute(counter + 1);
  if (current >= std::numeric_limits<int16_t>::max()) FBF_FATAL("engagement counter overflow");
  setValue(counter + 1, current + 1);
}

VIRScoutlumeSession::VIRScoutlumeSession() : PropensitySession(*entityNamed(kEntityName)) {}
VIRWayfinSession::VIRWayfinSession() : PropensitySession(*entityNamed(kEntityName)) {}
VIRImagesSession::VIRImagesSession() : PropensitySession(*entityNamed(kEntityName)) {}

std::shared_ptr<ManagedObject> makeRecord(const EntityDescription& entity) {
  if (entity.name == VIRUsageEvent::kEntityName) return std::make_shared<VIRUsageEvent>();
  if (entity.name == VIRCategory::kEntityName) return std::make_shared<VIRCategory>();
  if (entity.name == VIRFlushEvent::kEntityName) return std::make_shared<VIRFlushEvent>();
  if (entity.name == VIRScoutlumeSession::kEntityName) return std::make_shared<VIRScoutlumeSession>();
  if (entity.name == VIRWayfinSession::kEntityName) return std::make_shared<VIRWayfinSession>();
  if (entity.name == VIRImagesSession::kEntityName) return std::make_shared<VIRImagesSession>();
  return std::make_shared<ManagedObject>(entity);
}

}  // namespace fbf
