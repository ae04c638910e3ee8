// A container directory in the making: a bundle and what lies beside it, out of sight until it is whole.
#pragma once

#include <cstdint>
#include <string>
#include <vector>

#include "embedded/disk.h"
#include "embedded/package_reader.h"
#include "platform/error.h"
#include "platform/property_list.h"

namespace appsync {

class EmbeddedFileManager;

// Made below `parent` as ".incoming-NAME", and moved to "NAME" when it is kept; destroyed before, it leaves nothing.
// Nothing is written outside of it: each path is walked from its directory handle, no link is followed, and what is
// there already is never opened. Paths of a `PackageSink` are relative to the bundle. One thread.
//
// Errors are of the installer's domain, with the failure of the disk as the underlying error.
class FreshContainer : public PackageSink {
 public:
  // `subject` is what errors are about: 'The package "/x.ipa"'.
  FreshContainer(EmbeddedFileManager& files, const std::string& parent, const std::string& name, std::string subject);
  ~FreshContainer() override;
  FreshContainer(const FreshContainer&) = delete;
  FreshContainer& operator=(const FreshContainer&) = delete;

  bool bundle(const std::string& name, ErrorOut error) override;
  bool directory(const std::string& path, ErrorOut error) override;
  bool beginFile(const std::string& path, bool executable, ErrorOut error) override;
  bool bytes(const void* data, std::size_t size, ErrorOut error) override;
  bool endFile(ErrorOut error) override;
  bool link(const std::string& path, const std::string& target, ErrorOut error) override;

  bool file(const std::string& path, const Bytes& content, ErrorOut error);
  // A file of zeros that takes no room.
  bool emptyFile(const std::string& path, std::uint64_t size, ErrorOut error);
  // A property list in the container itself, or in the bundle.
  bool propertyListBeside(const std::string& name, const PropertyList& content, ErrorOut error);
  bool propertyList(const std::string& path, const PropertyList& content, ErrorOut error);

  const std::string& bundleName() const { return _bundleName; }  // empty before `bundle`
  std::string bundlePath() const { return _path + "/" + _bundleName; }
  // Bytes of all files in it.
  std::uint64_t size() const;

  // Flushes everything and moves it to its name, where it stays. Paths are the final ones from then on.
  bool keep(ErrorOut error);
  // Where it is: for now, or finally.
  const std::string& path() const { return _path; }

 private:
  bool fail(const std::string& what, const std::string& path, int errorNumber, ErrorOut error) const;
  bool fail(const Error& underlying, ErrorOut error) const;
  // The handle of the directory that holds the path, and the name in it.
  int directoryOf(const std::string& path, std::string& name);

  EmbeddedFileManager& _files;
  Disk& _disk;
  const std::string _finalPath;
  const std::string _subject;
  std::string _path;
  bool _made = false;
  bool _kept = false;

  OwnedFile _container;
  OwnedFile _bundle;
  std::string _bundleName;
  std::string _openPath;  // of the directory opened last
  OwnedFile _openDirectory;
  OwnedFile _file;
  std::string _filePath;
};

}  // namespace appsync
