#include "embedded/device_service.h"

#include <algorithm>

namespace appsync {

void EmbeddedDeviceService::prioritizeAsset(const DovelAssetRef& asset, Completion completion) {
  const std::string& identifier = asset->identifier();
  std::optional<Error> error;
  {
    MutexLock lock(_mutex);
    const auto place = std::find(_waiting.begin(), _waiting.end(), identifier);
    if (place != _waiting.end()) {
      std::rotate(_waiting.begin(), place, place + 1);
    } else if (_inFlight != identifier) {
      error = Error(std::string(kTransferErrorDomain), kTransferUnknown,
                    "no package of " + identifier + " is on its way to the device");
    }
    if (!error) _prioritized.insert(identifier);
    _changed.notify_all();
  }
  if (completion) {
    _executor.post("device-service", [completion = std::move(completion), error] { completion(error); });
  }
}

void EmbeddedDeviceService::cancelAssetTransferForFailedAsset(const DovelAssetRef& asset) {
  const std::string& identifier = asset->identifier();
  MutexLock lock(_mutex);
  const bool waits = std::find(_waiting.begin(), _waiting.end(), identifier) != _waiting.end();
  if (!waits && !_begun.contains(identifier)) return;
  _dropped.insert(identifier);
  _changed.notify_all();
}

void EmbeddedDeviceService::setQueue(const std::vector<std::string>& identifiers) {
  MutexLock lock(_mutex);
  _waiting.assign(identifiers.begin(), identifiers.end());
  _begun.clear();
  _inFlight.reset();
  _dropped.clear();
  _prioritized.clear();
}

std::optional<EmbeddedDeviceService::Turn> EmbeddedDeviceService::takeNext() {
  MutexLock lock(_mutex);
  _inFlight.reset();
  if (_waiting.empty()) return std::nullopt;
  auto next = _waiting.begin();
  if (!_dropped.empty()) {
    const auto dropped =
        std::find_if(_waiting.begin(), _waiting.end(),
                     [this](const std::string& one) APPSYNC_NO_THREAD_ANALYSIS { return _dropped.contains(one); });
    if (dropped != _waiting.end()) next = dropped;
  }
  _inFlight = *next;
  _begun.insert(*next);
  _waiting.erase(next);
  return Turn{*_inFlight, _dropped.contains(*_inFlight)};
}

bool EmbeddedDeviceService::isDropped(const std::string& identifier) {
  MutexLock lock(_mutex);
  return _dropped.contains(identifier);
}

bool EmbeddedDeviceService::waitUntilDropped(const std::string& identifier, Waiting& waiting, Waiting::Time deadline) {
  MutexLock lock(_mutex);
  return waiting.wait(lock.native(), _changed, deadline,
                      [&]() APPSYNC_NO_THREAD_ANALYSIS { return _dropped.contains(identifier); });
}

bool EmbeddedDeviceService::waitUntilPrioritized(const std::string& identifier, Waiting& waiting,
                                                 Waiting::Time deadline) {
  MutexLock lock(_mutex);
  return waiting.wait(lock.native(), _changed, deadline,
                      [&]() APPSYNC_NO_THREAD_ANALYSIS { return _prioritized.contains(identifier); });
}

}  // namespace appsync
