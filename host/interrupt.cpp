#include "host/interrupt.h"

#include <poll.h>
#include <sys/eventfd.h>
#include <sys/signalfd.h>
#include <unistd.h>

#include <array>
#include <csignal>

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

Interrupt::Interrupt() {
  const sigset_t set = watchedSignals();
  ::pthread_sigmask(SIG_BLOCK, &set, nullptr);
  _signals = ::signalfd(-1, &set, SFD_CLOEXEC | SFD_NONBLOCK);
  _stop = ::eventfd(0, EFD_CLOEXEC);
  _thread = std::thread([this] { listen(); });
}

// What comes now is left to the system, which ends the program.
Interrupt::~Interrupt() {
  const std::uint64_t one = 1;
  if (::write(_stop, &one, sizeof one) < 0) std::abort();
  _thread.join();
  ::close(_signals);
  ::close(_stop);
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
    std::array<pollfd, 2> waited{pollfd{_signals, POLLIN, 0}, pollfd{_stop, POLLIN, 0}};
    if (::poll(waited.data(), waited.size(), -1) < 0) continue;
    if ((waited[1].revents & POLLIN) != 0) return;
    signalfd_siginfo information{};
    if (::read(_signals, &information, sizeof information) != static_cast<ssize_t>(sizeof information)) continue;
    const auto number = static_cast<int>(information.ssi_signo);
    if (_signal != 0) ::_exit(128 + number);
    MutexLock lock(_mutex);
    _signal = number;
    if (_handler) _handler();
  }
}

}  // namespace appsync
