// The daemon's record of one application that travels between the host and the device.
#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string>

#include "platform/file_url.h"
#include "platform/property_list.h"

namespace appsync {

// Shared between the daemon and the client; one thread at a time uses it, so each call of the daemon hands it over.
class DovelAsset {
 public:
  // A record of a transfer from the host to the device.
  static std::shared_ptr<DovelAsset> downloadAssetWithIdentifier(std::string identifier, std::string dataclass,
                                                                 std::optional<std::string> prettyName);

  const std::string& identifier() const { return _identifier; }  // the application's bundle identifier
  const std::string& dataclass() const { return _dataclass; }
  const std::optional<std::string>& prettyName() const { return _prettyName; }  // shown to a person

  // Filled in by the client.
  const std::optional<std::string>& assetType() const { return _assetType; }
  void setAssetType(std::string type) { _assetType = std::move(type); }
  const std::optional<FileURL>& icon() const { return _icon; }  // shown while the application is pending
  void setIcon(std::optional<FileURL> icon) { _icon = std::move(icon); }
  bool isRestore() const { return _isRestore; }
  void setIsRestore(bool isRestore) { _isRestore = isRestore; }
  const PropertyList& variantOptions() const { return _variantOptions; }  // a dictionary: "AssetParts", "Version"
  void setVariantOptions(PropertyList options) { _variantOptions = std::move(options); }
  const std::optional<std::string>& storePlist() const { return _storePlist; }  // path of the store metadata
  void setStorePlist(std::string path) { _storePlist = std::move(path); }
  const std::optional<std::string>& infoPlist() const { return _infoPlist; }  // path of the Info.plist
  void setInfoPlist(std::string path) { _infoPlist = std::move(path); }

  // Filled in by the daemon.
  std::int64_t storePID() const { return _storePID; }
  void setStorePID(std::int64_t id) { _storePID = id; }
  const std::optional<std::string>& path() const { return _path; }  // the received file; relative: to the staging area
  void setPath(std::optional<std::string> path) { _path = std::move(path); }
  bool isDownload() const { return _isDownload; }  // from the host to the device
  void setIsDownload(bool isDownload) { _isDownload = isDownload; }
  std::uint64_t completedAssetParts() const { return _completedAssetParts; }  // the part that has been transferred
  void setCompletedAssetParts(std::uint64_t parts) { _completedAssetParts = parts; }
  float downloadProgress() const { return _downloadProgress; }  // 0.0 to 1.0
  void setDownloadProgress(float fraction) { _downloadProgress = fraction; }
  float installProgress() const { return _installProgress; }  // 0.0 to 1.0
  void setInstallProgress(float fraction) { _installProgress = fraction; }

  std::string shortDescription() const { return _identifier; }
  // The identifier, the name, and what else is known.
  std::string description() const;

 private:
  DovelAsset(std::string identifier, std::string dataclass, std::optional<std::string> prettyName);

  std::string _identifier;
  std::string _dataclass;
  std::optional<std::string> _prettyName;
  std::optional<std::string> _assetType;
  std::optional<FileURL> _icon;
  bool _isRestore = false;
  PropertyList _variantOptions = PropertyList::dictionary();
  std::optional<std::string> _storePlist;
  std::optional<std::string> _infoPlist;
  std::int64_t _storePID = 0;
  std::optional<std::string> _path;
  bool _isDownload = false;
  std::uint64_t _completedAssetParts = 0;
  float _downloadProgress = 0;
  float _installProgress = 0;
};

using DovelAssetRef = std::shared_ptr<DovelAsset>;

}  // namespace appsync
