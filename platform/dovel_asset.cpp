#include "platform/dovel_asset.h"

namespace appsync {

DovelAsset::DovelAsset(std::string identifier, std::string dataclass, std::optional<std::string> prettyName)
    : _identifier(std::move(identifier)), _dataclass(std::move(dataclass)), _prettyName(std::move(prettyName)) {}

DovelAssetRef DovelAsset::downloadAssetWithIdentifier(std::string identifier, std::string dataclass,
                                                      std::optional<std::string> prettyName) {
  auto asset =
      std::shared_ptr<DovelAsset>(new DovelAsset(std::move(identifier), std::move(dataclass), std::move(prettyName)));
  asset->_isDownload = true;
  return asset;
}

std::string DovelAsset::description() const {
  std::string text = "<asset " + _identifier;
  if (_prettyName) text += " '" + *_prettyName + "'";
  if (_variantOptions.count() > 0) text += " " + _variantOptions.description();
  if (_isRestore) text += " restore";
  if (_path) text += " at " + *_path;
  return text + ">";
}

}  // namespace appsync
