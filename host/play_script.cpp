#include "host/play_script.h"

#include <algorithm>
#include <array>
#include <filesystem>
#include <functional>
#include <map>

#include "host/files.h"
#include "host/json.h"
#include "instrument/faults.h"

namespace appsync {

namespace {

// Answers what is wrong with a value; empty when nothing is.
using Check = std::string (*)(const Json& value);

std::string isText(const Json& value) {
  return value.is_string() ? "" : "must be a text";
}
std::string isTextOrNull(const Json& value) {
  return value.is_string() || value.is_null() ? "" : "must be a text or null";
}
std::string isFlag(const Json& value) {
  return value.is_boolean() ? "" : "must be true or false";
}
std::string isFlagOrNumber(const Json& value) {
  return value.is_boolean() || value.is_number_integer() ? "" : "must be true or false";
}
std::string isFraction(const Json& value) {
  return value.is_number() ? "" : "must be a number";
}
std::string isInteger(const Json& value) {
  constexpr std::int64_t kLowest = std::numeric_limits<std::int32_t>::min();
  constexpr std::int64_t kHighest = std::numeric_limits<std::uint32_t>::max();
  const bool fits =
      value.is_number_integer() && (!value.is_number_unsigned() || value.get<std::uint64_t>() <= kHighest);
  return fits && value.get<std::int64_t>() >= kLowest ? "" : "must be an integer of at most 32 bits";
}
std::string isNumberOfBytes64(const Json& value) {
  const bool fits =
      value.is_number_integer() &&
      (!value.is_number_unsigned() ||
       value.get<std::uint64_t>() <= static_cast<std::uint64_t>(std::numeric_limits<std::int64_t>::max()));
  return fits ? "" : "must be an integer of at most 64 bits";
}
std::string isAnything(const Json&) {
  return "";
}
std::string isDictionaryOrNull(const Json& value) {
  return value.is_object() || value.is_null() ? "" : "must be an object";
}

std::string isError(const Json& value) {
  if (value.is_null()) return "";
  if (!value.is_object()) return "must be an object with \"domain\" and \"code\", or null";
  for (const auto& [key, member] : value.items()) {
    if (key != "domain" && key != "code" && key != "text") return "has an unknown member \"" + key + "\"";
  }
  if (!value.contains("domain") || !value["domain"].is_string()) return "needs a text \"domain\"";
  if (!value.contains("code") || !isNumberOfBytes64(value["code"]).empty()) return "needs an integer \"code\"";
  if (value.contains("text") && !value["text"].is_string()) return "has a \"text\" that is none";
  return "";
}

struct Field {
  const char* name;
  Check check;
};

constexpr std::array kAssetFields{
    Field{"identifier", isText},
    Field{"dataclass", isText},
    Field{"prettyName", isTextOrNull},
    Field{"assetType", isTextOrNull},
    Field{"icon", isTextOrNull},
    Field{"isRestore", isFlagOrNumber},
    Field{"variantOptions", isDictionaryOrNull},
    Field{"version", isAnything},
    Field{"storePlist", isTextOrNull},
    Field{"infoPlist", isTextOrNull},
    Field{"storePID", isNumberOfBytes64},
    Field{"path", isTextOrNull},
    Field{"isDownload", isFlagOrNumber},
    Field{"completedAssetParts", isInteger},
    Field{"downloadProgress", isFraction},
    Field{"installProgress", isFraction},
};

std::string checkFields(const Json& object, const Field* begin, const Field* end) {
  for (const auto& [key, value] : object.items()) {
    const auto* field = std::find_if(begin, end, [&, name = key](const Field& one) { return name == one.name; });
    if (field == end) return "has an unknown member \"" + key + "\"";
    if (const std::string wrong = field->check(value); !wrong.empty()) return "has a \"" + key + "\" that " + wrong;
  }
  return "";
}

std::string isAsset(const Json& value) {
  if (!value.is_object() || !value.contains("identifier")) return "must be an object with an \"identifier\"";
  return checkFields(value, kAssetFields.data(), kAssetFields.data() + kAssetFields.size());
}

std::string isOperationOfDevice(const Json& value) {
  return value == "prioritizeAsset" || value == "cancelAssetTransferForFailedAsset"
             ? ""
             : "must be \"prioritizeAsset\" or \"cancelAssetTransferForFailedAsset\"";
}

std::string isFault(const Json& value) {
  if (!value.is_string()) return "must be a text";
  Faults trial;
  std::optional<Error> error;
  return trial.add(value, false, std::nullopt, &error) ? "" : "cannot be: " + error->text();
}

// What each argument is, wherever it stands.
constexpr std::array kArguments{
    Field{"do", isText},
    Field{"type", isInteger},
    Field{"newAnchor", isText},
    Field{"hostAnchor", isText},
    Field{"success", isFlag},
    Field{"succeeded", isFlag},
    Field{"progress", isFraction},
    Field{"asset", isAsset},
    Field{"error", isError},
    Field{"givenError", isError},
    Field{"noErrorOut", isFlag},
    Field{"identifier", isTextOrNull},
    Field{"reason", isError},
    Field{"client", isInteger},
    Field{"number", isInteger},
    Field{"host", isText},
    Field{"file", isText},
    Field{"to", isText},
    Field{"operation", isOperationOfDevice},
    Field{"spec", isFault},
};

struct Action {
  const char* name;
  PlayStepKind kind;
  std::vector<const char*> needed;
  std::vector<const char*> allowed;
};

std::vector<Action> actions() {
  using enum PlayStepKind;
  const std::vector<const char*> errorOut{"givenError", "noErrorOut"};
  return {
      {"supportedDataclasses", Call, {}, {}},
      {"currentSyncAnchor", Call, {}, {}},
      {"prepareForSyncWithHostAnchor", Call, {}, {"hostAnchor", "givenError", "noErrorOut"}},
      {"installedAssets", Call, {}, {}},
      {"installedAssetMetrics", Call, {}, {}},
      {"reconcileSync", Call, {}, {"type", "newAnchor", "givenError", "noErrorOut"}},
      {"reconcileRestoreOfType", Call, {}, {"type", "givenError", "noErrorOut"}},
      {"syncEndedWithSuccess", Call, {}, {"success"}},
      {"outstandingAssetTransfers", Call, {}, {}},
      {"assetTransferSucceeded", Call, {"asset"}, {"succeeded", "error"}},
      {"assetTransferUpdatedProgress", Call, {"asset"}, {"progress"}},
      {"assetInstallSucceeded", Call, {"asset"}, {}},
      {"assetInstallFailed", Call, {"asset"}, {"error"}},
      {"assetTransferEndedWithSuccess", Call, {}, {"success"}},
      {"clearSyncData", Call, {}, {}},
      {"zelkIDsForAssets", Call, {}, {}},
      {"accountsForAssets", Call, {}, {}},
      {"prepareForBackup", Call, {}, {}},
      {"disabledAssetTypes", Call, {}, {}},
      {"coordinatorShouldPrioritize", Callback, {"identifier"}, {"error"}},
      {"coordinatorDidInstallPlaceholder", Callback, {"identifier"}, {"error"}},
      {"coordinatorDidCompleteSuccessfully", Callback, {"identifier"}, {"error"}},
      {"coordinatorCanceledWithReason", Callback, {"identifier"}, {"error", "reason", "client"}},
      {"promiseDidBeginFulfillmentWithIdentifier", Callback, {"number"}, {"identifier"}},
      {"applicationInstallsDidCancel", Callback, {}, {"identifier"}},
      {"stage", World, {"host"}, {}},
      {"push", World, {"file", "to"}, {}},
      {"startupComplete", World, {}, {}},
      {"settle", World, {}, {}},
      {"lack", World, {"operation"}, {}},
      {"fault", World, {"spec"}, {}},
  };
}

// What is wrong with a step; empty, with the step read, when nothing is.
std::string readStep(const Json& content, PlayStep& step) {
  if (!content.is_object() || !content.contains("do")) return "must be an object with \"do\"";
  if (std::string wrong = checkFields(content, kArguments.data(), kArguments.data() + kArguments.size());
      !wrong.empty()) {
    return wrong;
  }
  step.action = content["do"].get<std::string>();
  step.content = jsonLine(content);
  for (const Action& action : actions()) {
    if (step.action != action.name) continue;
    step.kind = action.kind;
    for (const char* name : action.needed) {
      if (!content.contains(name)) return "\"" + step.action + "\" needs \"" + name + "\"";
    }
    for (const auto& [key, value] : content.items()) {
      const auto names = [name = key](const char* one) { return name == one; };
      if (key != "do" && std::none_of(action.needed.begin(), action.needed.end(), names) &&
          std::none_of(action.allowed.begin(), action.allowed.end(), names)) {
        return "\"" + step.action + "\" does not take \"" + key + "\"";
      }
    }
    const std::int64_t type = numberArgument(content, "type");
    if (step.action == "reconcileSync" && type < 0) return "has a \"type\" below 0";
    if (step.action == "reconcileRestoreOfType" && type > std::numeric_limits<std::int32_t>::max()) {
      return "has a \"type\" that is larger than a signed number of 32 bits";
    }
    return "";
  }
  return "there is nothing called \"" + step.action + "\" to do";
}

std::string readSteps(const Json& document, PlayScript& script) {
  if (!document.is_object()) return "it must be an object with \"steps\"";
  for (const auto& [key, value] : document.items()) {
    if (key != "host" && key != "steps") return "it has an unknown member \"" + key + "\"";
  }
  if (document.contains("host")) {
    if (!document["host"].is_string()) return "\"host\" must be the identifier of a process";
    script.mainBundleIdentifier = document["host"].get<std::string>();
  }
  if (!document.contains("steps") || !document["steps"].is_array()) return "it needs an array \"steps\"";
  for (const Json& content : document["steps"]) {
    PlayStep step;
    const std::string wrong = readStep(content, step);
    if (!wrong.empty()) return "step " + std::to_string(script.steps.size() + 1) + " " + wrong;
    script.steps.push_back(std::move(step));
  }
  return "";
}

const Json* present(const Json& object, const char* name) {
  const auto found = object.find(name);
  return found == object.end() || found->is_null() ? nullptr : &*found;
}

std::optional<std::string> optionalText(const Json& object, const char* name) {
  const Json* value = present(object, name);
  return value == nullptr ? std::nullopt : std::optional(value->get<std::string>());
}

}  // namespace

std::optional<PlayScript> readPlayScript(const std::string& path, Failure& failure) {
  const std::optional<Bytes> bytes = readInput(path, failure);
  if (!bytes) return std::nullopt;
  std::optional<Error> error;
  const auto document = parseJson({reinterpret_cast<const char*>(bytes->data()), bytes->size()}, &error);
  PlayScript script;
  script.directory = std::filesystem::path(path).parent_path().string();
  const std::string wrong = document ? readSteps(*document, script) : "it is no JSON document: " + error->text();
  if (wrong.empty()) return script;
  failure = {FailureCode::ScriptRefused, "the script \"" + path + "\" cannot be played: " + wrong,
             "mend it; nothing has been done"};
  return std::nullopt;
}

std::string textArgument(const Json& step, const char* name) {
  return optionalText(step, name).value_or("");
}

std::optional<std::string> identifierArgument(const Json& step) {
  return optionalText(step, "identifier");
}

bool flagArgument(const Json& step, const char* name, bool whenAbsent) {
  const Json* value = present(step, name);
  if (value == nullptr) return whenAbsent;
  return value->is_boolean() ? value->get<bool>() : value->get<std::int64_t>() != 0;
}

std::int64_t numberArgument(const Json& step, const char* name) {
  const Json* value = present(step, name);
  return value == nullptr ? 0 : value->get<std::int64_t>();
}

double fractionArgument(const Json& step, const char* name) {
  const Json* value = present(step, name);
  return value == nullptr ? 0 : value->get<double>();
}

std::optional<Error> errorArgument(const Json& step, const char* name) {
  const Json* value = present(step, name);
  if (value == nullptr) return std::nullopt;
  return Error(value->at("domain").get<std::string>(), value->at("code").get<std::int64_t>(),
               value->value("text", std::string()));
}

DovelAssetRef assetArgument(const Json& step) {
  const Json& fields = step.at("asset");
  auto asset = DovelAsset::downloadAssetWithIdentifier(fields.at("identifier"),
                                                       optionalText(fields, "dataclass").value_or("Application"),
                                                       optionalText(fields, "prettyName"));
  if (const auto type = optionalText(fields, "assetType")) asset->setAssetType(*type);
  if (const auto icon = optionalText(fields, "icon")) asset->setIcon(FileURL::fileURLWithPath(*icon, false));
  if (const auto path = optionalText(fields, "storePlist")) asset->setStorePlist(*path);
  if (const auto path = optionalText(fields, "infoPlist")) asset->setInfoPlist(*path);
  PropertyList options = PropertyList::dictionary();
  if (const Json* given = present(fields, "variantOptions")) options = propertyListFromJson(*given);
  if (!options.isDictionary()) options = PropertyList::dictionary();
  if (const Json* version = present(fields, "version")) options.set("Version", propertyListFromJson(*version));
  asset->setVariantOptions(options);
  asset->setPath(optionalText(fields, "path"));
  asset->setIsRestore(flagArgument(fields, "isRestore", false));
  asset->setIsDownload(flagArgument(fields, "isDownload", true));
  asset->setStorePID(numberArgument(fields, "storePID"));
  asset->setCompletedAssetParts(static_cast<std::uint64_t>(numberArgument(fields, "completedAssetParts")));
  asset->setDownloadProgress(static_cast<float>(fractionArgument(fields, "downloadProgress")));
  asset->setInstallProgress(static_cast<float>(fractionArgument(fields, "installProgress")));
  return asset;
}

Json assetDocument(const DovelAsset& asset) {
  return {{"identifier", asset.identifier()},
          {"dataclass", asset.dataclass()},
          {"prettyName", orNull(asset.prettyName())},
          {"assetType", orNull(asset.assetType())},
          {"icon", asset.icon() ? Json(asset.icon()->path()) : Json(nullptr)},
          {"isRestore", asset.isRestore()},
          {"variantOptions", jsonFromPropertyList(asset.variantOptions())},
          {"storePlist", orNull(asset.storePlist())},
          {"infoPlist", orNull(asset.infoPlist())},
          {"storePID", asset.storePID()},
          {"path", orNull(asset.path())},
          {"isDownload", asset.isDownload()},
          {"completedAssetParts", asset.completedAssetParts()},
          {"downloadProgress", jsonFromPropertyList(PropertyList::real32(asset.downloadProgress()))},
          {"installProgress", jsonFromPropertyList(PropertyList::real32(asset.installProgress()))}};
}

}  // namespace appsync
