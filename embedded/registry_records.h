// The registry's records, as they stand in the state store: "applications/ID" and "placeholders/ID".
#pragma once

#include <cstdint>
#include <map>
#include <optional>
#include <string>
#include <vector>

#include "embedded/state_store.h"
#include "platform/pellum.h"
#include "platform/property_list.h"

namespace appsync {

inline constexpr char kContainersDirectory[] = "/var/mobile/Containers";
inline constexpr char kPlaceholdersDirectory[] = "/var/mobile/Containers/Placeholders";

// What a seeded record says of an install that is under way. Kept with the record, so that later processes show it.
struct SeededInstall {
  std::optional<std::uint64_t> installState;
  std::optional<std::uint64_t> installPhase;
  std::optional<bool> prioritized;
  bool progress = true;  // false: no progress is known of the install

  PellumInstallProgress shown() const { return {installState.value_or(0), installPhase.value_or(0)}; }
};

// Its fields "installState", "installPhase", "prioritized" and "progress" in a record, in a device's status and in a
// seed; none when they say nothing.
std::optional<SeededInstall> seededInstallIn(const PropertyList& record);
void setSeededInstall(PropertyList& record, const std::optional<SeededInstall>& seeded);

// Containers and arrivals are numbered from 1. A number from here on counts as none, so that numbering never ends.
inline constexpr std::uint64_t kSerialLimit = UINT64_MAX / 2;

// An installed application, as the installer hands it over.
struct InstalledApplication {
  std::string bundleID;
  std::string name;  // shown to people; empty: the bundle names none
  std::optional<std::string> bundleVersion;
  std::string applicationType = "User";
  std::string containerPath;            // a device path; the record takes it over
  std::string bundlePath;               // a device path in the container
  std::uint64_t size = 0;               // bytes of all files in the container
  std::optional<SeededInstall> seeded;  // for a seeded device only
};

struct ApplicationRecord {
  InstalledApplication application;
  std::uint64_t arrival = 0;        // the place among all that came to the device; kept by updates
  std::string replacedPlaceholder;  // container of the placeholder that this install has ended; empty: there was none

  PropertyList propertyList() const;
  PellumApplicationProxy proxy() const;
};

struct PlaceholderRecord {
  std::string bundleID;
  std::string name;
  std::uint64_t installType = 0;
  std::string applicationType;
  std::optional<std::string> bundleVersion;
  bool launchProhibited = false;
  std::string containerPath;
  std::uint64_t arrival = 0;
  std::optional<SeededInstall> seeded;

  PropertyList propertyList() const;
  // As it is when no install of it is shown.
  PellumApplicationProxy proxy() const;
};

std::string applicationRecordName(const std::string& bundleID);
std::string placeholderRecordName(const std::string& bundleID);

// None for a property list that is no such record.
std::optional<ApplicationRecord> applicationRecord(const std::string& bundleID, const PropertyList& stored);
std::optional<PlaceholderRecord> placeholderRecord(const std::string& bundleID, const PropertyList& stored);

// All records of a store, by identifier. `unreadable`, when given, is set to true when there is one that cannot be
// read; it is left out.
std::map<std::string, ApplicationRecord> loadApplicationRecords(const StateStore& store, bool* unreadable);
std::map<std::string, PlaceholderRecord> loadPlaceholderRecords(const StateStore& store, bool* unreadable);

// Every identifier once, in the order of arrival.
std::vector<std::string> identifiersByArrival(const std::map<std::string, ApplicationRecord>& applications,
                                              const std::map<std::string, PlaceholderRecord>& placeholders);

}  // namespace appsync
