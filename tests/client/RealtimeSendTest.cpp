// What RealtimeReporter::send must not do ends the process that does it: an allocation, a lock, a
// system call.
#include <dlfcn.h>
#include <gtest/gtest.h>
#include <linux/filter.h>
#include <linux/seccomp.h>
#include <pthread.h>
#include <sys/prctl.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include <csignal>
#include <cstddef>
#include <cstdlib>
#include <functional>

#include "client/RealtimeReporter.h"

namespace {

bool armed = false;
void* volatile kept;  // or the compiler would leave the allocation out
constexpr int kAllocated = 100;
constexpr int kLocked = 101;

void forbid(int status) {
  if (armed) _exit(status);
}

template <class Function>
Function* next(const char* name) {
  return reinterpret_cast<Function*>(dlsym(RTLD_NEXT, name));
}

}  // namespace

extern "C" {
void* __libc_malloc(std::size_t bytes);
void* __libc_calloc(std::size_t count, std::size_t bytes);
void* __libc_realloc(void* old, std::size_t bytes);
void __libc_free(void* memory);

void* malloc(std::size_t bytes) {
  forbid(kAllocated);
  return __libc_malloc(bytes);
}
void* calloc(std::size_t count, std::size_t bytes) {
  forbid(kAllocated);
  return __libc_calloc(count, bytes);
}
void* realloc(void* old, std::size_t bytes) {
  forbid(kAllocated);
  return __libc_realloc(old, bytes);
}
void free(void* memory) {
  forbid(kAllocated);
  __libc_free(memory);
}
int pthread_mutex_lock(pthread_mutex_t* mutex) {
  forbid(kLocked);
  static auto* const real = next<int(pthread_mutex_t*)>("pthread_mutex_lock");
  return real(mutex);
}
int pthread_mutex_trylock(pthread_mutex_t* mutex) {
  forbid(kLocked);
  static auto* const real = next<int(pthread_mutex_t*)>("pthread_mutex_trylock");
  return real(mutex);
}
}

namespace vx {

namespace {

// From here on any system call but the one to end ends the process with SIGSYS.
bool forbidSystemCalls() {
  sock_filter code[] = {
      BPF_STMT(BPF_LD | BPF_W | BPF_ABS, offsetof(seccomp_data, nr)),
      BPF_JUMP(BPF_JMP | BPF_JEQ | BPF_K, SYS_exit_group, 0, 1),
      BPF_STMT(BPF_RET | BPF_K, SECCOMP_RET_ALLOW),
      BPF_STMT(BPF_RET | BPF_K, SECCOMP_RET_KILL_PROCESS),
  };
  const sock_fprog program{std::size(code), code};
  return prctl(PR_SET_NO_NEW_PRIVS, 1, 0, 0, 0) == 0 &&
         prctl(PR_SET_SECCOMP, SECCOMP_MODE_FILTER, &program) == 0;
}

// How a child ends that does this and nothing else.
int statusOf(const std::function<void()>& work) {
  const pid_t child = fork();
  if (child == 0) {
    if (!forbidSystemCalls()) _exit(102);
    armed = true;
    work();
    _exit(0);
  }
  int status = -1;
  EXPECT_EQ(waitpid(child, &status, 0), child);
  return status;
}

TEST(RealtimeSendTest, NeitherAllocatesNorLocksNorCallsTheSystem) {
  using Kind = RealtimeReporter::Kind;
  RealtimeReporter reporter(
      {{{"i", Kind::Integer}, {"d", Kind::Double}, {"b", Kind::Boolean}}, 1, 2, {}}, 100);
  const int sent = statusOf([&] {
    int taken = 0;
    for (int i = 0; i < 1000; ++i) taken += reporter.send({i, 0.5, true}) ? 1 : 0;
    if (reporter.send({1}) || reporter.send({1.5, 1, 0.0}) || taken != 128) _exit(1);
  });
  EXPECT_TRUE(WIFEXITED(sent)) << "signal " << WTERMSIG(sent);
  EXPECT_EQ(WEXITSTATUS(sent), 0) << "100: it allocated, 101: it locked, 102: no seccomp here";

  // That it would have been noticed.
  pthread_mutex_t mutex = PTHREAD_MUTEX_INITIALIZER;
  EXPECT_EQ(WEXITSTATUS(statusOf([] { kept = malloc(1); })), kAllocated);
  EXPECT_EQ(WEXITSTATUS(statusOf([&] { pthread_mutex_lock(&mutex); })), kLocked);
  EXPECT_EQ(WTERMSIG(statusOf([] { getppid(); })), SIGSYS);
}

}  // namespace
}  // namespace vx
