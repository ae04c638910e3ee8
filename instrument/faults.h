// Which calls are to fail.
#pragma once

#include <cstdint>
#include <initializer_list>
#include <optional>
#include <span>
#include <string>
#include <string_view>
#include <vector>

#include "instrument/operations.h"
#include "platform/error.h"
#include "platform/thread_annotations.h"

namespace appsync {

// What a call is about: applications, or paths. Refers to texts of the call, and is valid for as long as they are.
class Subject {
 public:
  static Subject none() { return {}; }
  static Subject application(std::string_view bundleID);
  static Subject applications(const std::vector<std::string>& bundleIDs);
  static Subject path(std::string_view path);
  static Subject paths(std::string_view first, std::string_view second);

  bool concerns(std::string_view bundleID) const;
  // The first application or path; empty when there is neither.
  std::string text() const;

 private:
  std::string_view _bundleID;
  const std::vector<std::string>* _bundleIDs = nullptr;
  std::string_view _paths[2];
};

// Any thread.
class Faults {
 public:
  // What makes a call fail; the error is absent where the operation is to bring none.
  struct Hit {
    std::optional<Error> error;
  };

  // False, with an error, for a spec that is not OPERATION[=ID][@N]. The error of a hit is `given`, or with
  // `givenInstead` false one of our own.
  bool add(const std::string& spec, bool givenInstead, const std::optional<Error>& given, ErrorOut error);
  void clear();

  // Counts the call, and answers whether it is to fail.
  std::optional<Hit> strike(std::string_view operation, const Subject& subject);

 private:
  struct Fault {
    std::string_view operation;  // as the table has it
    std::optional<std::string> bundleID;
    std::uint64_t onlyCall = 0;  // 0: every one
    std::uint64_t calls = 0;
    Hit hit;
  };

  static std::optional<Fault> parse(const std::string& spec, ErrorOut error);

  Mutex _mutex;
  std::vector<Fault> _faults APPSYNC_GUARDED_BY(_mutex);
};

}  // namespace appsync
