// How a sync goes, for a person: on a terminal a line for each application that is drawn anew, elsewhere a line for
// each thing that happens.
#pragma once

#include <chrono>
#include <condition_variable>
#include <map>
#include <string>
#include <thread>
#include <utility>
#include <vector>

#include "host/console.h"
#include "host/options.h"
#include "platform/thread_annotations.h"

namespace appsync {

// Whether a picture may be drawn over an earlier one: a person looks at a terminal that nothing else writes to.
bool canDrawInPlace(const DeviceOptionsGiven& options, const Console& console);

// Any thread. Applications that `begin` has not named are ignored.
class ProgressDisplay {
 public:
  // `drawsInPlace` false: lines only, on a terminal too. The console must outlive this.
  ProgressDisplay(Console& console, bool drawsInPlace);
  ~ProgressDisplay();
  ProgressDisplay(const ProgressDisplay&) = delete;
  ProgressDisplay& operator=(const ProgressDisplay&) = delete;

  // Applications by identifier and name, in the order of their lines. Once.
  void begin(const std::vector<std::pair<std::string, std::string>>& applications);

  void transferring(const std::string& identifier, double fraction);
  void installing(const std::string& identifier);  // the package has arrived
  void installed(const std::string& identifier);
  void failed(const std::string& identifier, const std::string& why);  // a first failure is not replaced

  // The last picture stays, and what is written to the console from then on comes below it.
  void end();

 private:
  enum class State : std::uint8_t { Waiting, Transferring, Installing, Installed, Failed };
  struct Row {
    std::string identifier;
    std::string name;
    State state = State::Waiting;
    double fraction = 0;
    std::string why;
  };

  void change(const std::string& identifier, State state, double fraction, const std::string& why);
  void tell(const Row& row) APPSYNC_REQUIRES(_mutex);
  void drawRepeatedly();
  void draw() APPSYNC_REQUIRES(_mutex);
  std::vector<const Row*> rowsToDraw(std::size_t room) const APPSYNC_REQUIRES(_mutex);
  std::string rowText(const Row& row, std::size_t columns) const APPSYNC_REQUIRES(_mutex);

  Console& _console;
  const bool _drawsInPlace;
  Mutex _mutex;
  std::condition_variable _changed;
  std::vector<Row> _rows APPSYNC_GUARDED_BY(_mutex);
  std::map<std::string, std::size_t> _places APPSYNC_GUARDED_BY(_mutex);
  bool _isStale APPSYNC_GUARDED_BY(_mutex) = false;
  bool _hasEnded APPSYNC_GUARDED_BY(_mutex) = false;
  std::size_t _drawnLines APPSYNC_GUARDED_BY(_mutex) = 0;
  std::size_t _nameWidth APPSYNC_GUARDED_BY(_mutex) = 0;
  std::thread _drawer;
};

}  // namespace appsync
