// Files of the machine that commands read and write.
#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>

#include "host/failure.h"
#include "platform/property_list.h"

namespace appsync {

// The whole file, up to 1 GiB. None, with the failure said, when it cannot be read.
std::optional<Bytes> readInput(const std::string& path, Failure& failure);

// The property list or JSON document in a file.
std::optional<PropertyList> readPropertyListOrJson(const std::string& path, Failure& failure);

// A file that appears in one step when it is finished: what stood there stays until then, and stays for good if the
// writing fails. What is no plain file (a device, a pipe) is written as it is.
class OutputFile {
 public:
  // Null, with the failure said, when it cannot be written.
  static std::unique_ptr<OutputFile> create(const std::string& path, Failure& failure);
  ~OutputFile();
  OutputFile(const OutputFile&) = delete;
  OutputFile& operator=(const OutputFile&) = delete;

  void write(std::string_view bytes);
  // False, with the failure said, when any write failed.
  bool finish(Failure& failure);

 private:
  OutputFile() = default;
  void flush();

  int _file = -1;
  int _error = 0;
  std::string _path;
  std::string _temporary;  // empty: written in place
  std::string _buffer;
};

// Opens a file to write at its end, for outputs that grow while something runs; makes it if it is not there. What it
// holds stays until `emptyOutput`, as the run may yet be refused. -1, with the failure said, when it cannot be written.
int openOutput(const std::string& path, Failure& failure);

// Takes away what a plain file holds. 0 or an error number.
int emptyOutput(int file);

Failure outputFailure(const std::string& path, int errorNumber);

}  // namespace appsync
