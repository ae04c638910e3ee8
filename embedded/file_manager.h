// The device's files: its absolute paths, in a directory of the machine.
//
// Every path is walked from that directory down, one component after the other, and no link on the way is followed: so
// nothing outside of it is ever read or written, whatever the device's files have been made into. What the embedded
// device keeps for itself beside the device's own files (DIR/state and DIR/lock) cannot be named.
#pragma once

#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "embedded/disk.h"
#include "platform/error.h"
#include "platform/file_manager.h"

namespace appsync {

inline constexpr std::uint64_t kLargestFileRead = 256ULL << 20;

// An error of the domain "FileError": "Cannot OPERATION "PATH": text of the number" and, where there is something that
// would mend it, what.
Error fileError(const std::string& operation, const std::string& path, int errorNumber);

// A new file that is written in pieces. It appears at its path, in the place of an older one, when it is finished; one
// that is destroyed before leaves nothing behind. One thread.
class FileSink {
 public:
  FileSink(Disk& disk, std::string path, OwnedFile directory, std::string name, OwnedFile file, std::string temporary);
  ~FileSink();
  FileSink(const FileSink&) = delete;
  FileSink& operator=(const FileSink&) = delete;

  // False, with an error, ends it: nothing appears any more.
  bool append(const void* bytes, std::size_t size, ErrorOut error);

  // Flushes, puts it in place and flushes the directory. False, with an error, leaves an older file as it was, unless
  // it was the last of these that failed.
  bool finish(ErrorOut error);

 private:
  bool fail(int errorNumber, ErrorOut error);

  Disk& _disk;
  const std::string _path;
  const OwnedFile _directory;
  const std::string _name;
  const OwnedFile _file;
  std::string _temporary;  // empty once there is none
};

class EmbeddedFileManager : public FileManager {
 public:
  // `root` is a directory of the machine; it may be made later. `disk` must outlive this.
  EmbeddedFileManager(std::string root, Disk& disk);

  std::string temporaryDirectory() override;
  bool fileExists(const std::string& path) override;
  std::optional<Bytes> readFile(const std::string& path, ErrorOut error) override;
  bool writeFile(const std::string& path, BytesView bytes, ErrorOut error) override;
  bool createFile(const std::string& path, BytesView bytes, const FileAttributes& attributes) override;
  bool createDirectory(const std::string& path, bool intermediateDirectories, const FileAttributes& attributes,
                       ErrorOut error) override;
  bool removeItem(const std::string& path, ErrorOut error) override;
  bool moveItem(const std::string& from, const std::string& to, ErrorOut error) override;
  bool copyItem(const std::string& from, const std::string& to, ErrorOut error) override;
  std::optional<FileInformation> attributesOfItem(const std::string& path, ErrorOut error) override;
  int utimes(const std::string& path) override;
  std::string strerror(int errorNumber) override;

  // --- for the services of the embedded device and its host ---------------------------------------------------------

  // Where the path lies on the machine; for messages, and for programs that only read.
  std::string hostPath(const std::string& path) const;
  const std::string& root() const { return _root; }
  Disk& disk() const { return _disk; }

  // A directory of the device. None, with an error, when there is none or a link is on the way.
  OwnedFile openDirectory(const std::string& path, ErrorOut error) const;
  // A regular file of the device, for reading only.
  OwnedFile openFile(const std::string& path, ErrorOut error) const;
  // A file to be written in pieces; its directory exists. Null, with an error.
  std::unique_ptr<FileSink> openSink(const std::string& path, ErrorOut error) const;

  // Names in a directory, sorted. None, with an error, when there is no such directory or it cannot be read.
  std::optional<std::vector<std::string>> contentsOfDirectory(const std::string& path, ErrorOut error) const;
  // Bytes of all regular files at and below the path; 0 when nothing is there.
  std::uint64_t treeSize(const std::string& path) const;
  // Whether a directory (and no link to one) is there.
  bool isDirectory(const std::string& path) const;
  // Flushes a directory and everything below it, before it is renamed into place. False, with an error.
  bool flushTree(const std::string& path, ErrorOut error) const;

  // Removes the temporary files that a crash has left anywhere below the root. Answers how many went.
  std::size_t removeLeftTemporaryFiles() const;

  // The same directory for the embedded device itself: its own files can be named too ("/state/settings.plist"), and
  // errors name the file on the machine.
  EmbeddedFileManager ownFiles() const { return EmbeddedFileManager(_root, _disk, true); }

 private:
  struct Place;  // a directory handle and the name in it

  EmbeddedFileManager(std::string root, Disk& disk, bool namesOwnFiles);

  int walkTo(const std::string& path, Place& place) const;
  int openRegularFile(const std::string& path, OwnedFile& file) const;
  int replaceFile(const std::string& path, const FileAttributes& attributes,
                  const std::function<int(int file)>& fill) const;
  int makeDirectory(int above, const std::string& name, const FileAttributes& attributes) const;
  Error error(const std::string& operation, const std::string& path, int errorNumber) const;

  const std::string _root;
  Disk& _disk;
  const bool _namesOwnFiles;
};

}  // namespace appsync
