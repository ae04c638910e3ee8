#include "instrument/shown.h"

#include <array>
#include <charconv>

namespace appsync {

namespace {

// "[a, b]"
template <class Collection>
std::string shownAll(const Collection& values) {
  std::string text = "[";
  for (const auto& value : values) {
    if (text.size() > 1) text += ", ";
    text += shown(value);
  }
  return text + "]";
}

}  // namespace

std::string shown(double fraction) {
  std::array<char, 32> text;
  const auto end = std::to_chars(text.data(), text.data() + text.size(), fraction).ptr;
  return {text.data(), end};
}

std::string shown(BytesView bytes) {
  return std::to_string(bytes.size()) + " bytes";
}

std::string shown(const FileInformation& information) {
  return information.isDirectory ? "directory" : std::to_string(information.size) + " bytes";
}

std::string shown(const FileAttributes& attributes) {
  return "as " + attributes.ownerAccountName.value_or("-") + ":" + attributes.groupOwnerAccountName.value_or("-");
}

std::string shown(const std::set<OstrelClientID>& clients) {
  return shownAll(clients);
}

std::string shown(const std::vector<std::string>& texts) {
  return shownAll(texts);
}

std::string shown(const KilnStoreMetadata& metadata) {
  return shown(metadata.dictionary());
}

std::string shown(const KilnInstallOptions& options) {
  return field("installType", options.pellumInstallType()) + " " + field("target", options.installTargetType()) + " " +
         field("metadata", options.tarvoMetadata());
}

std::string shown(const OstrelPlaceholderAttributes& attributes) {
  return field("version", attributes.bundleVersion()) + " " + field("launchProhibited", attributes.launchProhibited()) +
         " " + field("info", attributes.infoPlist());
}

std::string shown(OstrelCoordinatorKind kind) {
  switch (kind) {
    case OstrelCoordinatorKind::Any:
      return "any";
    case OstrelCoordinatorKind::Initiating:
      return "initiating";
    case OstrelCoordinatorKind::Updating:
      return "updating";
    case OstrelCoordinatorKind::Restoring:
      return "restoring";
    case OstrelCoordinatorKind::RestoringDemoted:
      return "restoring-demoted";
  }
  return "unknown";
}

std::string shown(OstrelPromiseKind kind) {
  return kind == OstrelPromiseKind::TransferToPath ? "to-path" : "out-of-band";
}

std::string shown(TessaBoolean value) {
  switch (value) {
    case TessaBoolean::NotSet:
      return "not set";
    case TessaBoolean::Yes:
      return "yes";
    case TessaBoolean::No:
      return "no";
  }
  return std::to_string(static_cast<unsigned>(value));
}

std::string shown(const PellumApplicationProxy& record) {
  return record.description();
}

std::string shown(const PellumApplicationProxies& records) {
  return shownAll(records);
}

std::string shown(const Bundle& bundle) {
  return bundle.url.path();
}

std::string shown(const Image& image) {
  return std::to_string(image.width) + "x" + std::to_string(image.height);
}

}  // namespace appsync
