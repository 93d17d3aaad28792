// Threads of the Linux platform.
#pragma once

#include <pthread.h>
#include <signal.h>

#include <string>
#include <string_view>
#include <thread>
#include <utility>

#include "base/Function.h"

namespace vx::lnx {

// While one lives, threads that the caller starts begin with every signal blocked: signals belong
// to the event loop's signalfd.
class SignalsBlocked {
 public:
  SignalsBlocked() {
    sigset_t all;
    sigfillset(&all);
    pthread_sigmask(SIG_SETMASK, &all, &before_);
  }
  ~SignalsBlocked() { pthread_sigmask(SIG_SETMASK, &before_, nullptr); }
  SignalsBlocked(const SignalsBlocked&) = delete;
  SignalsBlocked& operator=(const SignalsBlocked&) = delete;

 private:
  sigset_t before_;
};

// A thread with a name (of which the kernel keeps 15 characters). std::system_error when the
// process may have no more.
inline std::thread startThread(std::string_view name, Function<void()> body) {
  const SignalsBlocked blocked;
  return std::thread([name = std::string(name.substr(0, 15)), body = std::move(body)] {
    pthread_setname_np(pthread_self(), name.c_str());
    body();
  });
}

}  // namespace vx::lnx
