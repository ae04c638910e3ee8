#include "platform/error.h"

#include <utility>
#include <vector>

#include "platform/property_list.h"

namespace appsync {

struct Error::State {
  std::string domain;
  std::int64_t code;
  std::string text;
  std::optional<Error> underlying;
};

Error::Error(std::string domain, std::int64_t code) : Error(std::move(domain), code, std::string()) {}

Error::Error(std::string domain, std::int64_t code, std::string text)
    : _state(std::make_shared<const State>(State{std::move(domain), code, std::move(text), std::nullopt})) {}

Error::Error(std::string domain, std::int64_t code, std::string text, const Error& underlying)
    : _state(std::make_shared<const State>(State{std::move(domain), code, std::move(text), underlying})) {}

const std::string& Error::domain() const {
  return _state->domain;
}
std::int64_t Error::code() const {
  return _state->code;
}
const std::string& Error::text() const {
  return _state->text;
}
std::optional<Error> Error::underlyingError() const {
  return _state->underlying;
}

PropertyList Error::information() const {
  std::vector<const State*> chain;
  for (const State* state = _state.get(); state != nullptr;
       state = state->underlying ? state->underlying->_state.get() : nullptr) {
    chain.push_back(state);
  }
  PropertyList inner = PropertyList::dictionary();
  for (std::size_t i = chain.size(); i-- > 0;) {
    PropertyList information = PropertyList::dictionary();
    if (!chain[i]->text.empty()) information.set("Text", chain[i]->text);
    if (chain[i]->underlying) {
      PropertyList underlying = PropertyList::dictionary();
      underlying.set("Domain", chain[i + 1]->domain);
      underlying.set("Code", PropertyList::integer(chain[i + 1]->code));
      underlying.set("Information", std::move(inner));
      information.set("Underlying", std::move(underlying));
    }
    inner = std::move(information);
  }
  return inner;
}

std::string Error::description() const {
  std::string text;
  std::size_t open = 0;
  for (const State* state = _state.get(); state != nullptr;
       state = state->underlying ? state->underlying->_state.get() : nullptr) {
    if (state != _state.get()) {
      text += " (";
      ++open;
    }
    text += state->domain + ' ' + std::to_string(state->code);
    if (!state->text.empty()) text += ": " + state->text;
  }
  return text.append(open, ')');
}

bool operator==(const Error& a, const Error& b) {
  const Error::State* left = a._state.get();
  const Error::State* right = b._state.get();
  while (left != right) {
    if (left->domain != right->domain || left->code != right->code || left->text != right->text) return false;
    if (left->underlying.has_value() != right->underlying.has_value()) return false;
    if (!left->underlying) return true;
    left = left->underlying->_state.get();
    right = right->underlying->_state.get();
  }
  return true;
}

}  // namespace appsync
