#include "host/interrupt.h"

#include <poll.h>
#include <sys/eventfd.h>
#include <sys/signalfd.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <csignal>
#include <cstring>
#include <system_error>

namespace appsync {

namespace {

sigset_t watchedSignals() {
  sigset_t set;
  sigemptyset(&set);
  sigaddset(&set, SIGINT);
  sigaddset(&set, SIGTERM);
  return set;
}

}  // namespace

bool Interrupt::start(Failure& failure) {
  const auto refuse = [&](int error, const std::string& hint) {
    failure = {FailureCode::Internal, std::string("signals cannot be watched: ") + std::strerror(error), hint};
    return false;
  };
  const sigset_t set = watchedSignals();
  _signals = OwnedFile(::signalfd(-1, &set, SFD_CLOEXEC | SFD_NONBLOCK));
  if (_signals) _stop = OwnedFile(::eventfd(0, EFD_CLOEXEC));
  if (!_stop) return refuse(errno, "raise the limit of open files");
  ::pthread_sigmask(SIG_BLOCK, &set, nullptr);
  try {
    _thread = std::thread([this] { listen(); });
  } catch (const std::system_error& error) {
    ::pthread_sigmask(SIG_UNBLOCK, &set, nullptr);
    return refuse(error.code().value(), "raise the limit of processes");
  }
  return true;
}

// What comes now is left to the system, which ends the program.
Interrupt::~Interrupt() {
  if (!_thread.joinable()) return;
  const std::uint64_t one = 1;
  if (::write(_stop.get(), &one, sizeof one) < 0) std::abort();
  _thread.join();
  const sigset_t set = watchedSignals();
  ::pthread_sigmask(SIG_UNBLOCK, &set, nullptr);
}

void Interrupt::setHandler(std::function<void()> handler) {
  MutexLock lock(_mutex);
  _handler = std::move(handler);
  if (_signal != 0 && _handler) _handler();
}

void Interrupt::listen() {
  while (true) {
    std::array<pollfd, 2> waited{pollfd{_signals.get(), POLLIN, 0}, pollfd{_stop.get(), POLLIN, 0}};
    if (::poll(waited.data(), waited.size(), -1) < 0) continue;
    if ((waited[1].revents & POLLIN) != 0) return;
    signalfd_siginfo information{};
    if (::read(_signals.get(), &information, sizeof information) != static_cast<ssize_t>(sizeof information)) continue;
    const auto number = static_cast<int>(information.ssi_signo);
    if (_signal != 0) ::_exit(128 + number);
    MutexLock lock(_mutex);
    _signal = number;
    if (_handler) _handler();
  }
}

}  // namespace appsync
