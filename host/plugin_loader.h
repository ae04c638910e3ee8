// Loads the plug-in that holds the client.
#pragma once

#include <memory>
#include <optional>
#include <string>

#include "host/failure.h"
#include "platform/dovel_client.h"
#include "platform/platform.h"
#include "platform/plugin.h"

namespace appsync {

// A plug-in that has been loaded; it stays in memory to the end of the process.
class Plugin {
 public:
  // The plug-in in `file`, or the one that belongs to this program: beside it, or where it was installed. None, with
  // the failure said, when there is none or it was built for another host.
  static std::optional<Plugin> load(const std::optional<std::string>& file, Failure& failure);

  // Null, with the failure said, when the plug-in makes none.
  std::unique_ptr<DovelClient> makeClient(const Platform& platform, Failure& failure) const;

 private:
  Plugin(std::string path, const DovelPluginDescriptor& descriptor)
      : _path(std::move(path)), _descriptor(&descriptor) {}

  std::string _path;
  const DovelPluginDescriptor* _descriptor;
};

}  // namespace appsync
