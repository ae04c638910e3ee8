// The script of `dovel play`: read, and checked as a whole before anything is done.
#pragma once

#include <optional>
#include <string>
#include <vector>

#include "host/failure.h"
#include "host/json_forward.h"
#include "platform/dovel_asset.h"
#include "platform/error.h"

namespace appsync {

// What the steps of a script can do, in groups that are carried out in different ways.
enum class PlayStepKind : std::uint8_t { Call, Callback, World };

struct PlayStep {
  PlayStepKind kind = PlayStepKind::Call;
  std::string action;   // "do"
  std::string content;  // the step, a JSON object; its arguments have the types that their names stand for
};

struct PlayScript {
  std::string directory;  // what file names in it are relative to
  std::string mainBundleIdentifier = "com.zelk.dovel";
  std::vector<PlayStep> steps;
};

// None, with the failure said: it names the step by its number.
std::optional<PlayScript> readPlayScript(const std::string& path, Failure& failure);

// Arguments of a checked step.
std::string textArgument(const Json& step, const char* name);
std::optional<std::string> identifierArgument(const Json& step);
bool flagArgument(const Json& step, const char* name, bool whenAbsent);
std::int64_t numberArgument(const Json& step, const char* name);
double fractionArgument(const Json& step, const char* name);
std::optional<Error> errorArgument(const Json& step, const char* name);
DovelAssetRef assetArgument(const Json& step);

Json assetDocument(const DovelAsset& asset);  // all fields by name, null where absent

}  // namespace appsync
