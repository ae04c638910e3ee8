#include "instrument/references.h"

namespace appsync {

namespace {

// Made-up references count down from the highest, where no service's come.
OstrelRef phantomRef(std::uint64_t number) {
  return {~number};
}

}  // namespace

NamedRef References::give(OstrelRef ref, const std::string& what, const std::string& name,
                          const std::string& bundleID) {
  if (!ref) return {};
  MutexLock lock(_mutex);
  Entry& entry = _entries[ref];
  ++entry.holds;
  entry.name = what + "(" + (name.empty() ? "(null)" : name) + ")";
  entry.bundleID = bundleID;
  return {ref, entry.name};
}

void References::lend(const OstrelAppInstallCoordinator& bareHandle, const std::string& bundleID) {
  give(bareHandle.ref(), "coordinator", bundleID, bundleID);
  MutexLock lock(_mutex);
  _entries[bareHandle.ref()].lent.push_back(bareHandle);
}

std::optional<OstrelAppInstallCoordinator> References::release(OstrelRef ref) {
  std::optional<OstrelAppInstallCoordinator> handle;
  MutexLock lock(_mutex);
  const auto found = _entries.find(ref);
  if (found == _entries.end()) return handle;
  Entry& entry = found->second;
  if (entry.phantom) handle.emplace();
  if (!entry.lent.empty()) {
    handle = std::move(entry.lent.back());
    entry.lent.pop_back();
  }
  if (--entry.holds == 0) _entries.erase(found);
  return handle;
}

OstrelRef References::givePhantom(std::optional<std::string> bundleID, std::optional<Error> error) {
  OstrelRef ref;
  {
    MutexLock lock(_mutex);
    ref = phantomRef(_phantoms++);
  }
  give(ref, "coordinator", bundleID.value_or(""), bundleID.value_or(""));
  MutexLock lock(_mutex);
  _entries[ref].phantom = Phantom{std::move(bundleID), std::move(error)};
  return ref;
}

std::optional<References::Phantom> References::phantom(OstrelRef ref) const {
  MutexLock lock(_mutex);
  const auto found = _entries.find(ref);
  return found == _entries.end() ? std::nullopt : found->second.phantom;
}

void References::setOwner(OstrelRef registration, const void* owner) {
  MutexLock lock(_mutex);
  const auto found = _entries.find(registration);
  if (found != _entries.end()) found->second.owner = owner;
}

const void* References::owner(OstrelRef ref) const {
  MutexLock lock(_mutex);
  const auto found = _entries.find(ref);
  return found == _entries.end() ? nullptr : found->second.owner;
}

NamedRef References::named(OstrelRef ref) const {
  if (!ref) return {};
  MutexLock lock(_mutex);
  const auto found = _entries.find(ref);
  return {ref, found == _entries.end() ? "unknown" : found->second.name};
}

std::string References::bundleID(OstrelRef ref) const {
  MutexLock lock(_mutex);
  const auto found = _entries.find(ref);
  return found == _entries.end() ? "" : found->second.bundleID;
}

}  // namespace appsync
