// The references that the coordination service has given out through a wrapper: what each names, and who holds it.
#pragma once

#include <cstddef>
#include <map>
#include <optional>
#include <string>
#include <vector>

#include "instrument/shown.h"
#include "platform/ostrel_objects.h"
#include "platform/thread_annotations.h"

namespace appsync {

// Any thread. Calls no service under its lock.
class References {
 public:
  // The service has given out one hold on the object.
  NamedRef give(OstrelRef ref, const std::string& what, const std::string& name, const std::string& bundleID);

  // The service has shown an object through a handle of its own, which is kept in exchange for one hold.
  void lend(const OstrelAppInstallCoordinator& bareHandle, const std::string& bundleID);

  // One hold less. What is to be done about it: let the handle go (it then held the object), or, without one, release
  // the object at the service.
  std::optional<OstrelAppInstallCoordinator> release(OstrelRef ref);

  // A made-up coordinator, with one hold.
  OstrelRef givePhantom(std::optional<std::string> bundleID, std::optional<Error> error);
  // What a made-up coordinator answers; none for what the service has given out.
  struct Phantom {
    std::optional<std::string> bundleID;
    std::optional<Error> error;
  };
  std::optional<Phantom> phantom(OstrelRef ref) const;

  // Whose events end when a registration is released; null when the object is none.
  void setOwner(OstrelRef registration, const void* owner);
  const void* owner(OstrelRef ref) const;

  NamedRef named(OstrelRef ref) const;
  // The application that it belongs to; empty when it is not known.
  std::string bundleID(OstrelRef ref) const;

 private:
  struct Entry {
    std::string name;  // for people
    std::string bundleID;
    std::size_t holds = 0;
    std::vector<OstrelAppInstallCoordinator> lent;  // as many of the holds are these handles'
    std::optional<Phantom> phantom;
    const void* owner = nullptr;
  };

  mutable Mutex _mutex;
  std::map<OstrelRef, Entry> _entries APPSYNC_GUARDED_BY(_mutex);
  std::uint64_t _phantoms APPSYNC_GUARDED_BY(_mutex) = 0;
};

}  // namespace appsync
