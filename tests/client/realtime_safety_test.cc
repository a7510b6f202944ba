#include <quarvel/realtime.hpp>

#include <dlfcn.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <linux/audit.h>
#include <linux/filter.h>
#include <linux/seccomp.h>
#include <pthread.h>
#include <sys/prctl.h>
#include <sys/syscall.h>
#include <ucontext.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <atomic>
#include <csignal>
#include <functional>
#include <mutex>
#include <thread>

#include "tests/TemporaryDirectory.h"
#include "tests/UnixSocket.h"

// Watches a producer's thread while it records: every allocation and every lock goes through the
// functions below, which stand before the C library's for the whole process, the shared library
// included; every system call is trapped by the kernel.

namespace {

thread_local bool watched = false;

std::array<const char*, 64> calls;  // the calls of a watched thread
std::atomic<std::size_t> callCount{0};

void Note(const char* call) {
  if (!watched) return;
  const std::size_t index = callCount.fetch_add(1);
  if (index < calls.size()) calls[index] = call;
}

}  // namespace

extern "C" {

void* __libc_malloc(std::size_t size);
void* __libc_calloc(std::size_t count, std::size_t size);
void* __libc_realloc(void* memory, std::size_t size);
void* __libc_memalign(std::size_t alignment, std::size_t size);
void __libc_free(void* memory);

// Stands for the C library's `name`.
#define QUARVEL_NOTE(type, name, parameters, result) \
  type name parameters {                             \
    Note(#name);                                     \
    return result;                                   \
  }
QUARVEL_NOTE(void*, malloc, (std::size_t size), __libc_malloc(size))
QUARVEL_NOTE(void*, calloc, (std::size_t count, std::size_t size), __libc_calloc(count, size))
QUARVEL_NOTE(void*, realloc, (void* memory, std::size_t size), __libc_realloc(memory, size))
QUARVEL_NOTE(void*, aligned_alloc, (std::size_t alignment, std::size_t size),
             __libc_memalign(alignment, size))
QUARVEL_NOTE(int, posix_memalign, (void** memory, std::size_t alignment, std::size_t size),
             (*memory = __libc_memalign(alignment, size)) == nullptr ? ENOMEM : 0)
QUARVEL_NOTE(void, free, (void* memory), __libc_free(memory))

#define QUARVEL_NOTE_LOCK(name, Lock)                                                     \
  int name(Lock* lock) noexcept {                                                         \
    static const auto next = reinterpret_cast<int (*)(Lock*)>(::dlsym(RTLD_NEXT, #name)); \
    Note(#name);                                                                          \
    return next(lock);                                                                    \
  }
QUARVEL_NOTE_LOCK(pthread_mutex_lock, pthread_mutex_t)
QUARVEL_NOTE_LOCK(pthread_mutex_trylock, pthread_mutex_t)
QUARVEL_NOTE_LOCK(pthread_rwlock_rdlock, pthread_rwlock_t)
QUARVEL_NOTE_LOCK(pthread_rwlock_wrlock, pthread_rwlock_t)
QUARVEL_NOTE_LOCK(pthread_spin_lock, pthread_spinlock_t)

}  // extern "C"

namespace quarvel {
namespace {

using namespace std::chrono_literals;
using ::testing::IsEmpty;
using ::testing::IsSupersetOf;

/// Notes a system call and lets it fail.
void OnSystemCall(int, siginfo_t*, void* context) {
  Note("a system call");
  auto& machine = static_cast<ucontext_t*>(context)->uc_mcontext;
#if defined(__x86_64__)
  machine.gregs[REG_RAX] = -ENOSYS;
#elif defined(__aarch64__)
  machine.regs[0] = static_cast<decltype(machine.regs[0])>(-ENOSYS);
#else
#error "Say which register holds a system call's result on this machine."
#endif
}

/// From here on the thread can only end: every other system call raises SIGSYS.
void TrapSystemCalls() {
  struct sigaction action {};
  action.sa_sigaction = OnSystemCall;
  action.sa_flags = SA_SIGINFO;
  ASSERT_EQ(::sigaction(SIGSYS, &action, nullptr), 0);
  sock_filter filter[] = {
      BPF_STMT(BPF_LD | BPF_W | BPF_ABS, offsetof(seccomp_data, nr)),
      BPF_JUMP(BPF_JMP | BPF_JEQ | BPF_K, SYS_exit, 1, 0),
      BPF_JUMP(BPF_JMP | BPF_JEQ | BPF_K, SYS_rt_sigreturn, 0, 1),  // the handler's own end
      BPF_STMT(BPF_RET | BPF_K, SECCOMP_RET_ALLOW),
      BPF_STMT(BPF_RET | BPF_K, SECCOMP_RET_TRAP),
  };
  sock_fprog program{std::size(filter), filter};
  ASSERT_EQ(::prctl(PR_SET_NO_NEW_PRIVS, 1, 0, 0, 0), 0);
  ASSERT_EQ(::prctl(PR_SET_SECCOMP, SECCOMP_MODE_FILTER, &program, 0, 0), 0);
}

/// Runs `produce` on a watched thread. Returns its forbidden calls.
std::vector<std::string> Watch(const std::function<void()>& produce) {
  callCount = 0;
  pthread_t thread{};
  const auto run = [](void* given) -> void* {
    // malloc prepares each thread at its first call; then an allocation is no system call as well.
    void* volatile first = ::malloc(1);
    ::free(first);
    TrapSystemCalls();
    watched = true;
    (*static_cast<const std::function<void()>*>(given))();
    watched = false;
    ::syscall(SYS_exit, 0);  // the ordinary end of a thread makes more system calls
    return nullptr;
  };
  EXPECT_EQ(::pthread_create(&thread, nullptr, run,
                             const_cast<void*>(static_cast<const void*>(&produce))),
            0);
  EXPECT_EQ(::pthread_join(thread, nullptr), 0);
  return {calls.begin(), calls.begin() + std::min(callCount.load(), calls.size())};
}

// Records that fit, that are too large and that find the ring full, while the client's thread takes
// them out.
TEST(RealtimeSafety, TheProducerNeitherAllocatesNorLocksNorCallsTheSystem) {
  constexpr int kRecords = 200'000;
  const TemporaryDirectory directory;
  const std::string path = directory.path() / "reporting.sock";
  const int listener = BoundSocket(path, SOCK_STREAM);
  ASSERT_EQ(::listen(listener, 1), 0);
  // The service, which only reads.
  const std::jthread service([listener] {
    const int connection = ::accept(listener, nullptr, nullptr);
    std::vector<char> bytes(65'536);
    while (::recv(connection, bytes.data(), bytes.size(), 0) > 0) continue;
    ::close(connection);
    ::close(listener);
  });
  Client client = std::move(Client::connect(path).value());
  RealtimeReporter::Options options;
  options.interval = 1ms;
  RealtimeReporter reporter(client, 7, options);
  reporter.start();
  const auto record = [&reporter](int number) {
    reporter.record(vocabulary::Kind::playback, RealtimeReporter::MessageType::generic)
        .set("frames", number)
        .set("load", 0.5)
        .set("glitch", true)
        .set("route", "Speaker")
        .set("at", Date{})
        .send();
  };
  const std::string large(1'000, 'x');
  const auto called = Watch([&] {
    for (int i = 0; i < kRecords; ++i) {
      record(i);
      if (i % 64 == 0) {
        reporter.record(vocabulary::Kind::error, {}).set("text", std::string_view(large)).send();
      }
    }
  });
  EXPECT_THAT(called, IsEmpty());
  // The watch sees each forbidden call that is made beside a record.
  std::mutex mutex;
  const auto forbidden = Watch([&] {
    record(1);
    void* volatile memory = ::calloc(1, 1);
    memory = ::realloc(memory, 2);
    ::free(memory);
    const std::lock_guard lock(mutex);
    ::getppid();
  });
  EXPECT_THAT(forbidden,
              IsSupersetOf({"calloc", "realloc", "free", "pthread_mutex_lock", "a system call"}));
  reporter.stop();
  const auto [sent, lost] = reporter.statistics();
  EXPECT_GT(sent, 0U);
  EXPECT_GT(lost.full, 0U);
  EXPECT_GT(lost.tooLarge, 0U);
}

}  // namespace
}  // namespace quarvel
