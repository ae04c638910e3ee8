// The embedded device's own records: property lists in DIR/state, each in a file of its own and replaced in one step.
//
// A record's name is "COLLECTION/KEY" or a single word; a key is a bundle identifier or another single path component.
#pragma once

#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "platform/error.h"
#include "platform/property_list.h"

namespace appsync {

class EmbeddedFileManager;

// Any thread; whoever reads, changes and writes one record holds a lock of their own meanwhile.
class StateStore {
 public:
  virtual ~StateStore() = default;

  // None when there is no such record or it cannot be read; only the latter sets the error.
  virtual std::optional<PropertyList> load(const std::string& name, ErrorOut error) const = 0;
  // Durable when it answers true. False, with an error, leaves the old record, unless the new one had got its place and
  // could then not be flushed: it is what `load` answers from now on, and may be lost with power.
  virtual bool save(const std::string& name, const PropertyList& value, ErrorOut error) = 0;
  // A record that is not there is no failure.
  virtual bool remove(const std::string& name, ErrorOut error) = 0;
  // The keys of a collection, sorted.
  virtual std::vector<std::string> keys(const std::string& collection) const = 0;
  // Whether a record of the collection was found damaged, now or earlier, and has been moved aside.
  virtual bool hasSetAside(const std::string& collection) const = 0;
};

// Records as binary property lists at DIR/state/NAME.plist of the device whose files these are; directories are made
// with the first record in them. Errors name the file.
std::unique_ptr<StateStore> makeFileStateStore(EmbeddedFileManager& files);

// Whether a record means something to its service.
using RecordCheck = std::function<bool(const std::string& name, const PropertyList& record)>;

// Reads every record, and moves one that cannot be read or means nothing aside to NAME.plist.damaged, so that its
// service goes on without it. Appends a line for each to `repairs`; false, with an error, when one can be neither read
// nor moved.
bool repairStateRecords(EmbeddedFileManager& files, const RecordCheck& isMeaningful, std::vector<std::string>& repairs,
                        ErrorOut error);

// Whether every collection can be listed: one that cannot is not empty. The error names the directory.
bool canListStateRecords(EmbeddedFileManager& files, ErrorOut error);

// Whether this can be the name of one file or directory of an application: not empty, not "." or "..", no "/" and no
// NUL, valid UTF-8 and at most 200 bytes. The services of the device refuse every other bundle identifier.
bool isSinglePathComponent(const std::string& text);

}  // namespace appsync
