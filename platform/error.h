// Errors of the system: a domain, an integer code and an information dictionary.
//
// `Error` is an immutable value; copies share one state. It can be read from any thread.
#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <string_view>

namespace appsync {

class PropertyList;

// The domain of the daemon's own errors. The client makes them only as reasons for cancellations.
inline constexpr std::string_view kDovelErrorDomain = "DovelError";

class Error {
 public:
  // An error without information: prints as "DOMAIN CODE".
  Error(std::string domain, std::int64_t code);

  // `text` says to a person what went wrong (in which file, at which byte) and, where something can be done about it,
  // what would mend it. Prints as "DOMAIN CODE: TEXT".
  Error(std::string domain, std::int64_t code, std::string text);

  // An error that was caused by another one. Prints as "DOMAIN CODE: TEXT (UNDERLYING)".
  Error(std::string domain, std::int64_t code, std::string text, const Error& underlying);

  const std::string& domain() const;
  std::int64_t code() const;

  // The text for a person; empty when the error brings none.
  const std::string& text() const;

  // The error that caused this one, or none.
  std::optional<Error> underlyingError() const;

  // The information dictionary: "Text" and "Underlying" (a dictionary with "Domain", "Code" and an information
  // dictionary of its own), each only when present; so an error without information gives an empty dictionary.
  PropertyList information() const;

  std::string description() const;

  friend bool operator==(const Error& a, const Error& b);

 private:
  struct State;
  std::shared_ptr<const State> _state;
};

// Where an operation may leave an error: the caller's variable, or null when the caller does not want to know.
// Whether an operation touches it, and when, is part of the operation's meaning.
using ErrorOut = std::optional<Error>*;

inline void setError(ErrorOut out, std::optional<Error> error) {
  if (out != nullptr) *out = std::move(error);
}

}  // namespace appsync
