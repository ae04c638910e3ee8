// The low-level installer: what it remembers of uninstalled applications, and the records that configure an install.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <vector>

#include "platform/property_list.h"

namespace appsync {

// An application's store metadata, as the host or a backup brings it.
class KilnStoreMetadata {
 public:
  // None when there is no dictionary to make it from.
  static std::optional<KilnStoreMetadata> initWithDictionary(const std::optional<PropertyList>& dictionary) {
    if (!dictionary || !dictionary->isDictionary()) return std::nullopt;
    return KilnStoreMetadata(*dictionary);
  }

  const PropertyList& dictionary() const { return _dictionary; }

 private:
  explicit KilnStoreMetadata(PropertyList dictionary) : _dictionary(std::move(dictionary)) {}
  PropertyList _dictionary;
};

// How an application is to be installed.
class KilnInstallOptions {
 public:
  void setTarvoMetadata(std::optional<KilnStoreMetadata> metadata) { _tarvoMetadata = std::move(metadata); }
  void setPellumInstallType(std::uint64_t type) { _pellumInstallType = type; }
  void setInstallTargetType(std::uint64_t type) { _installTargetType = type; }

  const std::optional<KilnStoreMetadata>& tarvoMetadata() const { return _tarvoMetadata; }
  std::uint64_t pellumInstallType() const { return _pellumInstallType; }  // the registry's install types
  std::uint64_t installTargetType() const { return _installTargetType; }

 private:
  std::optional<KilnStoreMetadata> _tarvoMetadata;
  std::uint64_t _pellumInstallType = 0;
  std::uint64_t _installTargetType = 0;
};

// Any thread; never calls back, but may take long: not to be called under a lock.
class KilnInstaller {
 public:
  virtual ~KilnInstaller() = default;

  // A dictionary keyed by the bundle identifiers of the applications that have been uninstalled and are still
  // remembered; empty when nothing is remembered. None only when asking failed.
  virtual std::optional<PropertyList> KilnLookupUninstalled() = 0;

  // Forgets these; one that is not remembered is no failure. 0 on success, another number when nothing was forgotten.
  virtual int KilnClearUninstalled(const std::vector<std::string>& bundleIDs) = 0;
};

}  // namespace appsync
