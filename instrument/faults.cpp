#include "instrument/faults.h"

#include <algorithm>
#include <charconv>

#include "instrument/instruments.h"

namespace appsync {

namespace {

bool isFileOf(std::string_view component, std::string_view bundleID) {
  if (!component.starts_with(bundleID)) return false;
  const std::string_view rest = component.substr(bundleID.size());
  return rest.empty() || rest == ".png" || rest == ".app" || rest == ".ipa";
}

bool pathConcerns(std::string_view path, std::string_view bundleID) {
  while (!path.empty()) {
    const std::string_view component = path.substr(0, path.find('/'));
    if (isFileOf(component, bundleID)) return true;
    path.remove_prefix(std::min(component.size() + 1, path.size()));
  }
  return false;
}

std::nullopt_t refuse(ErrorOut error, std::string text) {
  setError(error, Error(std::string(kFaultErrorDomain), kFaultUnknown, std::move(text)));
  return std::nullopt;
}

}  // namespace

Subject Subject::application(std::string_view bundleID) {
  Subject subject;
  subject._bundleID = bundleID;
  return subject;
}

Subject Subject::applications(const std::vector<std::string>& bundleIDs) {
  Subject subject;
  subject._bundleIDs = &bundleIDs;
  return subject;
}

Subject Subject::path(std::string_view path) {
  return paths(path, {});
}

Subject Subject::paths(std::string_view first, std::string_view second) {
  Subject subject;
  subject._paths[0] = first;
  subject._paths[1] = second;
  return subject;
}

bool Subject::concerns(std::string_view bundleID) const {
  if (_bundleID == bundleID) return true;
  if (_bundleIDs != nullptr && std::find(_bundleIDs->begin(), _bundleIDs->end(), bundleID) != _bundleIDs->end()) {
    return true;
  }
  return pathConcerns(_paths[0], bundleID) || pathConcerns(_paths[1], bundleID);
}

std::string Subject::text() const {
  if (!_bundleID.empty()) return std::string(_bundleID);
  if (_bundleIDs != nullptr && !_bundleIDs->empty()) return _bundleIDs->front();
  return std::string(_paths[0]);
}

bool Faults::add(const std::string& spec, bool givenInstead, const std::optional<Error>& given, ErrorOut error) {
  std::optional<Fault> fault = parse(spec, error);
  if (!fault) return false;
  if (givenInstead) fault->hit.error = given;
  MutexLock lock(_mutex);
  _faults.push_back(std::move(*fault));
  return true;
}

void Faults::clear() {
  MutexLock lock(_mutex);
  _faults.clear();
}

std::optional<Faults::Hit> Faults::strike(std::string_view operation, const Subject& subject) {
  MutexLock lock(_mutex);
  std::optional<Hit> hit;
  for (Fault& fault : _faults) {
    if (fault.operation != operation || (fault.bundleID && !subject.concerns(*fault.bundleID))) continue;
    ++fault.calls;
    if (!hit && (fault.onlyCall == 0 || fault.onlyCall == fault.calls)) hit = fault.hit;
  }
  return hit;
}

std::optional<Faults::Fault> Faults::parse(const std::string& spec, ErrorOut error) {
  Fault fault;
  std::string_view rest = spec;
  if (const std::size_t at = rest.rfind('@'); at != std::string_view::npos) {
    const std::string_view number = rest.substr(at + 1);
    const char* const end = number.data() + number.size();
    const auto [stopped, problem] = std::from_chars(number.data(), end, fault.onlyCall);
    if (problem != std::errc() || stopped != end || fault.onlyCall == 0) {
      return refuse(error, "fault \"" + spec + "\": after the @ stands the number of the call that fails, from 1 on");
    }
    rest = rest.substr(0, at);
  }
  if (const std::size_t equals = rest.find('='); equals != std::string_view::npos) {
    fault.bundleID = rest.substr(equals + 1);
    rest = rest.substr(0, equals);
    if (fault.bundleID->empty()) {
      return refuse(error, "fault \"" + spec + "\": after the = stands an application's bundle identifier");
    }
  }
  const auto operations = faultableOperations();
  const auto found = std::find_if(operations.begin(), operations.end(), [&](auto& each) { return each.name == rest; });
  if (found == operations.end()) {
    return refuse(error, "fault \"" + spec + "\": no operation that can fail is called \"" + std::string(rest) +
                             "\"; `dovel faults` lists them");
  }
  if (fault.bundleID && !found->concernsApplication) {
    return refuse(error, "fault \"" + spec + "\": " + std::string(rest) +
                             " concerns no single application; leave the = and what follows it away");
  }
  fault.operation = found->name;
  fault.hit.error = Error(std::string(kFaultErrorDomain), kFaultMade, std::string(rest) + " was made to fail");
  return fault;
}

}  // namespace appsync
