// The device's files.

#include "instrument/wrappers.h"

namespace appsync {

namespace {

class WrappedFileManager : public FileManager {
 public:
  WrappedFileManager(FileManager& bare, Probe& probe) : _bare(bare), _probe(probe) {}

  std::string temporaryDirectory() override {
    return _probe.call("temporaryDirectory", Subject::none(), nullptr,
                       [&](ErrorOut) { return _bare.temporaryDirectory(); });
  }
  bool fileExists(const std::string& path) override {
    const auto answer = [&](ErrorOut) {
      return scripted(
          _probe.script()->fileExists, [&] { return _bare.fileExists(path); }, path);
    };
    return _probe.call("fileExists", Subject::path(path), nullptr, answer, path);
  }
  std::optional<Bytes> readFile(const std::string& path, ErrorOut error) override {
    const auto answer = [&](ErrorOut out) {
      return scripted(
          _probe.script()->readFile, [&] { return _bare.readFile(path, out); }, path);
    };
    return _probe.call("readFile", Subject::path(path), error, answer, path);
  }
  bool writeFile(const std::string& path, BytesView bytes, ErrorOut error) override {
    const auto forward = [&](ErrorOut out) { return _bare.writeFile(path, bytes, out); };
    return _probe.call("writeFile", Subject::path(path), error, forward, path, bytes);
  }
  bool createFile(const std::string& path, BytesView bytes, const FileAttributes& attributes) override {
    const auto forward = [&](ErrorOut) { return _bare.createFile(path, bytes, attributes); };
    return _probe.call("createFile", Subject::path(path), nullptr, forward, path, bytes, attributes);
  }
  bool createDirectory(const std::string& path, bool intermediateDirectories, const FileAttributes& attributes,
                       ErrorOut error) override {
    const auto forward = [&](ErrorOut out) {
      return _bare.createDirectory(path, intermediateDirectories, attributes, out);
    };
    return _probe.call("createDirectory", Subject::path(path), error, forward, path,
                       field("intermediate", intermediateDirectories), attributes);
  }
  bool removeItem(const std::string& path, ErrorOut error) override {
    const auto forward = [&](ErrorOut out) { return _bare.removeItem(path, out); };
    return _probe.call("removeItem", Subject::path(path), error, forward, path);
  }
  bool moveItem(const std::string& from, const std::string& to, ErrorOut error) override {
    const auto forward = [&](ErrorOut out) { return _bare.moveItem(from, to, out); };
    return _probe.call("moveItem", Subject::paths(from, to), error, forward, from, "to", to);
  }
  bool copyItem(const std::string& from, const std::string& to, ErrorOut error) override {
    const auto forward = [&](ErrorOut out) { return _bare.copyItem(from, to, out); };
    return _probe.call("copyItem", Subject::paths(from, to), error, forward, from, "to", to);
  }
  std::optional<FileInformation> attributesOfItem(const std::string& path, ErrorOut error) override {
    const auto forward = [&](ErrorOut out) { return _bare.attributesOfItem(path, out); };
    return _probe.call("attributesOfItem", Subject::path(path), error, forward, path);
  }
  int utimes(const std::string& path) override {
    return _probe.call(
        "utimes", Subject::path(path), nullptr, [&](ErrorOut) { return _bare.utimes(path); }, path);
  }
  // A lookup in a table of texts, nothing that happens.
  std::string strerror(int errorNumber) override { return _bare.strerror(errorNumber); }

 private:
  FileManager& _bare;
  Probe& _probe;
};

}  // namespace

std::unique_ptr<FileManager> wrap(FileManager& bare, Probe& probe) {
  return std::make_unique<WrappedFileManager>(bare, probe);
}

}  // namespace appsync
