// The records of the usage event store and the compiled object model that
// describes them.
//
// Six entities, each a table of the same name in cohorts.sqlite with one
// column per attribute and one integer column per to-one relationship holding
// the other row's rowid; dates are REAL seconds since 1970 (UTC):
//
//   VIRUsageEvent        timestamp (date), usageCategory (-> VIRCategory)
//   VIRCategory          clientIntVal (integer), usageEvent (-> VIRUsageEvent)
//   VIRFlushEvent        timestamp (date), type (integer, a FlushFrequency code)
//   VIRScoutlumeSession  timestamp, appLaunch, onDeviceAddressBookData,
//                        onDeviceOtherPersonalData, punchout,
//                        thirdPartyInAppContent, vireon, querySuggestion,
//                        vexaSuggestions, other (signed 16-bit counters)
//   VIRWayfinSession     timestamp, goToSite, localGoto, localTap, vireonGoto,
//                        vireonTap, thirdPartyCompletionOrRecentSearch,
//                        thirdPartyGoto, thirdPartyTap, other
//   VIRImagesSession     timestamp, image, querySuggestion, recentResult, zkw,
//                        other
//
// Records are made by a ManagedObjectContext (inserted, staged until the
// context saves) or materialised by its fetches. A record belongs to its
// context's serial queue: read and change it only from a task running there.
// Ownership: shared; the context keeps staged and changed records alive until
// they are saved or the context is reset.
#pragma once

#include "platform/clock.h"

#include <cstdint>
#include <map>
#include <memory>
#include <optional>
#include <string_view>
#include <variant>
#include <vector>

namespace fbf {

class ManagedObjectContext;

// The cohort aggregation period; the numeric codes are stored on disk.
enum class FlushFrequency : uint8_t { daily = 0, weekly = 1, monthly = 2 };

inline constexpr FlushFrequency kAllFlushFrequencies[] = {FlushFrequency::daily, FlushFrequency::weekly,
                                                         FlushFrequency::monthly};
inline int32_t rawValue(FlushFrequency f) { return static_cast<int32_t>(f); }
// No value for codes outside 0..2.
std::optional<FlushFrequency> flushFrequencyFromRawValue(int64_t raw);

// A half-open interval [start, end).
struct DateInterval {
  SystemTime start;
  SystemTime end;
  bool contains(SystemTime t) const { return start <= t && t < end; }
  bool operator==(const DateInterval&) const = default;
};

enum class AttributeType { date, integer, integer16 };

struct AttributeDescription {
  std::string_view name;
  AttributeType type;
};

struct RelationshipDescription {
  std::string_view name;
  std::string_view destination;
  // The owning side holds its destination alive; the inverse side does not,
  // so that the two never keep each other alive.
  bool owning;
};

struct EntityDescription {
  std::string_view name;
  std::vector<AttributeDescription> attributes;
  std::vector<RelationshipDescription> relationships;

  std::optional<size_t> attributeIndex(std::string_view attribute) const;
  std::optional<size_t> relationshipIndex(std::string_view relationship) const;
};

// The compiled object model "Cohorts": every entity, in a fixed order.
const std::vector<EntityDescription>& cohortsObjectModel();
// Null when the model has no entity of that name.
const EntityDescription* entityNamed(std::string_view name);

using AttributeValue = std::variant<std::monostate, double, int64_t>;

// One record. Typed subclasses below give the attributes their names.
class ManagedObject : public std::enable_shared_from_this<ManagedObject> {
 public:
  explicit ManagedObject(const EntityDescription& entity);
  virtual ~ManagedObject() = default;
  ManagedObject(const ManagedObject&) = delete;
  ManagedObject& operator=(const ManagedObject&) = delete;

  const EntityDescription& entity() const { return *entity_; }
  // The row's id once saved; 0 while the record is only staged.
  int64_t rowid() const { return rowid_; }

  const AttributeValue& value(size_t attribute) const { return values_.at(attribute); }
  void setValue(size_t attribute, AttributeValue value);

  // The related record, read from the store on first use when the record was
  // fetched; null when there is none or it cannot be read.
  std::shared_ptr<ManagedObject> related(size_t relationship) const;
  void setRelated(size_t relationship, const std::shared_ptr<ManagedObject>& destination);

 protected:
  std::optional<SystemTime> dateAttribute(size_t attribute) const;
  void setDateAttribute(size_t attribute, SystemTime date);
  int64_t integerAttribute(size_t attribute) const;

 private:
  friend class ManagedObjectContext;
  struct RelationshipSlot {
    std::shared_ptr<ManagedObject> strong;
    std::weak_ptr<ManagedObject> weak;
    // Destination row not yet materialised (0: none).
    int64_t unresolvedRowid = 0;
  };
  void didChange();

  const EntityDescription* entity_;
  std::vector<AttributeValue> values_;
  mutable std::vector<RelationshipSlot> relationships_;
  int64_t rowid_ = 0;
  std::weak_ptr<ManagedObjectContext> context_;
  // The context generation this record was staged or fetched in; a staged
  // record of an earlier generation was dropped by a reset.
  uint64_t generation_ = 0;
};

class VIRCategory;

class VIRUsageEvent final : public ManagedObject {
 public:
  static constexpr std::string_view kEntityName = "VIRUsageEvent";
  VIRUsageEvent();
  std::optional<SystemTime> timestamp() const { return dateAttribute(0); }
  void setTimestamp(SystemTime t) { setDateAttribute(0, t); }
  std::shared_ptr<VIRCategory> usageCategory() const;
  void setUsageCategory(const std::shared_ptr<VIRCategory>& category);
};

class VIRCategory final : public ManagedObject {
 public:
  static constexpr std::string_view kEntityName = "VIRCategory";
  VIRCategory();
  int64_t clientIntVal() const { return integerAttribute(0); }
  void setClientIntVal(int64_t v) { setValue(0, v); }
  std::shared_ptr<VIRUsageEvent> usageEvent() const;
  void setUsageEvent(const std::shared_ptr<VIRUsageEvent>& event);
};

class EventFactoryProtocol;

class VIRFlushEvent final : public ManagedObject {
 public:
  static constexpr std::string_view kEntityName = "VIRFlushEvent";
  VIRFlushEvent();
  std::optional<SystemTime> timestamp() const { return dateAttribute(0); }
  void setTimestamp(SystemTime t) { setDateAttribute(0, t); }
  int64_t type() const { return integerAttribute(1); }
  void setType(int64_t v) { setValue(1, v); }

  // A new flush event from the factory, stamped and typed; null when the
  // factory cannot make one.
  static std::shared_ptr<VIRFlushEvent> createFlushEvent(EventFactoryProtocol& factory, SystemTime timestamp,
                                                         FlushFrequency type);
};

// A per-session record of engagement counters of one surface. Attribute 0 is
// the timestamp; the counters follow in the entity's attribute order.
class PropensitySession : public ManagedObject {
 public:
  using ManagedObject::ManagedObject;
  std::optional<SystemTime> timestamp() const { return dateAttribute(0); }
  void setTimestamp(SystemTime t) { setDateAttribute(0, t); }

  size_t counterCount() const { return entity().attributes.size() - 1; }
  std::string_view counterName(size_t counter) const { return entity().attributes.at(counter + 1).name; }
  int16_t counter(size_t counter) const;
  // Adds one. Passing the largest signed 16-bit value is a programming error
  // and stops the process; the counter is never saturated.
  void incrementCounter(size_t counter);
};

class VIRScoutlumeSession final : public PropensitySession {
 public:
  static constexpr std::string_view kEntityName = "VIRScoutlumeSession";
  enum Counter : size_t {
    appLaunch,
    onDeviceAddressBookData,
    onDeviceOtherPersonalData,
    punchout,
    thirdPartyInAppContent,
    vireon,
    querySuggestion,
    vexaSuggestions,
    other,
  };
  VIRScoutlumeSession();
};

class VIRWayfinSession final : public PropensitySession {
 public:
  static constexpr std::string_view kEntityName = "VIRWayfinSession";
  enum Counter : size_t {
    goToSite,
    localGoto,
    localTap,
    vireonGoto,
    vireonTap,
    thirdPartyCompletionOrRecentSearch,
    thirdPartyGoto,
    thirdPartyTap,
    other,
  };
  VIRWayfinSession();
};

class VIRImagesSession final : public PropensitySession {
 public:
  static constexpr std::string_view kEntityName = "VIRImagesSession";
  enum Counter : size_t { image, querySuggestion, recentResult, zkw, other };
  VIRImagesSession();
};

// A new, unattached record of the entity's record class.
std::shared_ptr<ManagedObject> makeRecord(const EntityDescription& entity);

}  // namespace fbf
