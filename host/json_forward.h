// The name of a JSON value, for headers that only pass it on.
#pragma once

#include <nlohmann/json_fwd.hpp>

namespace appsync {

using Json = nlohmann::ordered_json;

}  // namespace appsync
