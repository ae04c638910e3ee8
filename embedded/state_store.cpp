#include "embedded/state_store.h"

#include <algorithm>
#include <cerrno>
#include <string_view>
#include <utility>

#include "embedded/file_manager.h"
#include "platform/utf8.h"

namespace appsync {

namespace {

constexpr char kStateDirectory[] = "/state";
constexpr std::string_view kRecordSuffix = ".plist";
constexpr std::string_view kDamagedSuffix = ".damaged";

// "COLLECTION/KEY" or a single word, and nothing that leads elsewhere.
bool isRecordName(const std::string& name) {
  const std::size_t slash = name.find('/');
  if (slash == std::string::npos) return isSinglePathComponent(name);
  return isSinglePathComponent(name.substr(0, slash)) && isSinglePathComponent(name.substr(slash + 1));
}

std::string pathOfRecord(const std::string& name) {
  return std::string(kStateDirectory) + "/" + name + std::string(kRecordSuffix);
}

std::string nameOfRecord(const std::string& path) {
  const std::size_t begin = std::string_view(kStateDirectory).size() + 1;
  return path.substr(begin, path.size() - kRecordSuffix.size() - begin);
}

Error refusedName(const std::string& name) {
  return Error(std::string(kFileErrorDomain), EINVAL, "\"" + name + "\" cannot be the name of a record");
}

// None when there is no such file or it cannot be read; only the latter sets the error.
std::optional<PropertyList> readRecord(EmbeddedFileManager& files, const std::string& path, ErrorOut error) {
  std::optional<Error> reason;
  const std::optional<Bytes> bytes = files.readFile(path, &reason);
  if (!bytes) {
    if (reason->code() != ENOENT) setError(error, reason);
    return std::nullopt;
  }
  std::optional<PropertyList> value = parsePropertyList(*bytes, &reason);
  if (!value) {
    setError(error, Error(std::string(kFileErrorDomain), EILSEQ,
                          "The record \"" + files.hostPath(path) + "\" cannot be read", *reason));
  }
  return value;
}

class FileStateStore : public StateStore {
 public:
  explicit FileStateStore(EmbeddedFileManager& files) : _files(files.ownFiles()) {}

  std::optional<PropertyList> load(const std::string& name, ErrorOut error) const override {
    if (isRecordName(name)) return readRecord(_files, pathOfRecord(name), error);
    setError(error, refusedName(name));
    return std::nullopt;
  }

  bool save(const std::string& name, const PropertyList& value, ErrorOut error) override {
    if (!isRecordName(name)) {
      setError(error, refusedName(name));
      return false;
    }
    const std::optional<Bytes> bytes = serializePropertyList(value, PropertyListFormat::Binary, error);
    if (!bytes) return false;
    const std::string path = pathOfRecord(name);
    const std::string directory = path.substr(0, path.rfind('/'));
    if (!_files.isDirectory(directory) && !_files.createDirectory(directory, true, {}, error)) return false;
    return _files.writeFile(path, *bytes, error);
  }

  bool remove(const std::string& name, ErrorOut error) override {
    std::optional<Error> reason = isRecordName(name) ? std::nullopt : std::optional(refusedName(name));
    if (!reason && !_files.removeItem(pathOfRecord(name), &reason) && reason->code() == ENOENT) reason.reset();
    if (reason) setError(error, reason);
    return !reason;
  }

  std::vector<std::string> keys(const std::string& collection) const override {
    std::vector<std::string> keys;
    if (!isSinglePathComponent(collection)) return keys;
    const auto names = _files.contentsOfDirectory(std::string(kStateDirectory) + "/" + collection, nullptr);
    for (const std::string& name : names.value_or(std::vector<std::string>{})) {
      if (name.ends_with(kRecordSuffix)) keys.push_back(name.substr(0, name.size() - kRecordSuffix.size()));
    }
    std::sort(keys.begin(), keys.end());
    return keys;
  }

  bool hasSetAside(const std::string& collection) const override {
    if (!isSinglePathComponent(collection)) return false;
    const auto names = _files.contentsOfDirectory(std::string(kStateDirectory) + "/" + collection, nullptr);
    return names && std::ranges::any_of(*names, [](const auto& name) { return name.ends_with(kDamagedSuffix); });
  }

 private:
  mutable EmbeddedFileManager _files;  // reading changes nothing in it
};

bool repairRecord(EmbeddedFileManager& files, const std::string& path, const RecordCheck& isMeaningful,
                  std::vector<std::string>& repairs, ErrorOut error) {
  std::optional<Error> reason;
  const std::optional<PropertyList> record = readRecord(files, path, &reason);
  if (record && !isMeaningful(nameOfRecord(path), *record)) {
    reason = Error(std::string(kFileErrorDomain), EILSEQ,
                   "The record \"" + files.hostPath(path) + "\" does not say what it must");
  }
  if (!reason) return true;
  const std::string aside = path + std::string(kDamagedSuffix);
  files.removeItem(aside, nullptr);
  if (!files.moveItem(path, aside, error)) return false;
  repairs.push_back(reason->description() + "; it has been moved to \"" + files.hostPath(aside) +
                    "\" and the device goes on without it");
  return true;
}

// Also of one that cannot be opened.
bool isDirectory(EmbeddedFileManager& files, const std::string& path) {
  const std::optional<FileInformation> information = files.attributesOfItem(path, nullptr);
  return information && information->isDirectory;
}

bool repairRecordsIn(EmbeddedFileManager& files, const std::string& directory, int depth,
                     const RecordCheck& isMeaningful, std::vector<std::string>& repairs, ErrorOut error) {
  const auto names = files.contentsOfDirectory(directory, error);
  if (!names) return false;
  for (const std::string& name : *names) {
    const std::string path = std::string(directory).append("/").append(name);
    if (name.ends_with(kRecordSuffix)) {
      if (!repairRecord(files, path, isMeaningful, repairs, error)) return false;
    } else if (depth > 0 && isDirectory(files, path)) {
      if (!repairRecordsIn(files, path, depth - 1, isMeaningful, repairs, error)) return false;
    }
  }
  return true;
}

}  // namespace

std::unique_ptr<StateStore> makeFileStateStore(EmbeddedFileManager& files) {
  return std::make_unique<FileStateStore>(files);
}

bool repairStateRecords(EmbeddedFileManager& files, const RecordCheck& isMeaningful, std::vector<std::string>& repairs,
                        ErrorOut error) {
  EmbeddedFileManager own = files.ownFiles();
  return repairRecordsIn(own, kStateDirectory, 1, isMeaningful, repairs, error);
}

bool canListStateRecords(EmbeddedFileManager& files, ErrorOut error) {
  EmbeddedFileManager own = files.ownFiles();
  const auto names = own.contentsOfDirectory(kStateDirectory, error);
  return names && std::ranges::all_of(*names, [&](const std::string& name) {
           const std::string path = std::string(kStateDirectory).append("/").append(name);
           return !isDirectory(own, path) || own.contentsOfDirectory(path, error).has_value();
         });
}

bool isSinglePathComponent(const std::string& text) {
  constexpr std::size_t kLongest = 200;
  if (text.empty() || text == "." || text == ".." || text.size() > kLongest) return false;
  if (text.find('/') != std::string::npos || text.find('\0') != std::string::npos) return false;
  return isUTF8(text);
}

}  // namespace appsync
