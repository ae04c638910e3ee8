// The backup service.
#pragma once

#include <memory>

#include "platform/error.h"

namespace appsync {

// A connection to the backup service. Any thread; never calls back; not to be called under a lock.
class VaultryManager {
 public:
  virtual ~VaultryManager() = default;

  // Whether placeholders are to be made for restored applications. When the answer is no, `error` may say why.
  virtual bool dovelShouldCreateAppPlaceholdersWithError(ErrorOut error) = 0;
};

class VaultryService {
 public:
  virtual ~VaultryService() = default;

  // Never null. The service must outlive it.
  virtual std::unique_ptr<VaultryManager> makeVaultryManager() = 0;
};

}  // namespace appsync
