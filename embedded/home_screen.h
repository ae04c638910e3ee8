// The home-screen shell of the embedded device: the layout of icons.
#pragma once

#include <cstddef>
#include <cstdint>
#include <optional>
#include <string>
#include <vector>

#include "embedded/state_store.h"
#include "platform/brelm.h"
#include "platform/thread_annotations.h"

namespace appsync {

class EmbeddedRegistry;

// The home screen shows first what the layout names, whether it is on the device or not, then everything else that is
// on the device, in the order in which it came; what goes from the device goes from the second part by itself. The
// layout is kept as it was pushed, in the record "homescreen". Whatever in it is neither an identifier, a page nor a
// folder is passed over; a layout that is no array is refused.
class EmbeddedHomeScreen : public BrelmShell {
 public:
  EmbeddedHomeScreen(StateStore& store, EmbeddedRegistry& registry);

  BrelmPort BrelmBlockableServerPort() override;
  int BrelmSetIconState(BrelmPort port, const std::uint8_t* bytes, std::size_t length) override;
  std::optional<Bytes> BrelmGetFlattenedIconState(BrelmPort port, std::uint32_t format) override;

  bool setLayout(const PropertyList& layout, ErrorOut error);  // an array
  std::vector<std::string> flattened();

 private:
  StateStore& _store;
  EmbeddedRegistry& _registry;

  Mutex _mutex;
  std::vector<std::string> _layout APPSYNC_GUARDED_BY(_mutex);  // flattened, each identifier once
};

// "homeScreen" of a device's status: an array of identifiers, flattened. Needs no shell and takes no lock.
PropertyList homeScreenStatus(const StateStore& store);

// Whether this layout can be seeded, and seeding it: it replaces the one that is there.
bool checkHomeScreenSeed(const PropertyList& layout, ErrorOut error);
bool seedHomeScreen(EmbeddedHomeScreen& homeScreen, const PropertyList& layout, ErrorOut error);

}  // namespace appsync
