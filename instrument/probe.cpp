#include "instrument/probe.h"

namespace appsync {

void Probe::deliver(InstrumentedService service, std::string_view event, const std::string& bundleID, const void* owner,
                    const std::string& shown, std::function<void()> action) {
  const std::shared_ptr<const ScriptedAnswers> around = script();
  const EventFate fate = around->event ? around->event(std::string(event), bundleID) : EventFate::Deliver;
  auto recorded = [this, service, text = std::string(event) + " " + shown, action = std::move(action)] {
    recorder.addCallback(service, text);
    action();
  };
  switch (fate) {
    case EventFate::Lose:
      return;
    case EventFate::Hold: {
      MutexLock lock(_mutex);
      _held.push_back({owner, std::move(recorded)});
      return;
    }
    case EventFate::Double:
      recorded();
      [[fallthrough]];
    case EventFate::Deliver:
      recorded();
  }
}

std::size_t Probe::releaseHeldEvents() {
  std::vector<HeldEvent> events;
  {
    MutexLock lock(_mutex);
    events.swap(_held);
  }
  for (const HeldEvent& event : events) event.action();
  return events.size();
}

void Probe::dropHeldEvents() {
  std::vector<HeldEvent> events;  // what they hold goes when no lock is held
  MutexLock lock(_mutex);
  events.swap(_held);
}

void Probe::forget(const void* owner) {
  std::vector<HeldEvent> dropped;
  MutexLock lock(_mutex);
  std::vector<HeldEvent> kept;
  for (HeldEvent& event : _held) (event.owner == owner ? dropped : kept).push_back(std::move(event));
  _held = std::move(kept);
}

std::shared_ptr<const ScriptedAnswers> Probe::script() const {
  MutexLock lock(_mutex);
  return _script;
}

void Probe::setScript(ScriptedAnswers answers) {
  std::shared_ptr<const ScriptedAnswers> next = std::make_shared<ScriptedAnswers>(std::move(answers));
  MutexLock lock(_mutex);
  _script.swap(next);
}

}  // namespace appsync
