#include "queues/Thread.h"

#include <signal.h>
#include <sys/resource.h>
#include <unistd.h>

#include <algorithm>
#include <memory>
#include <utility>

#if defined(__has_feature)
#if __has_feature(thread_sanitizer) || __has_feature(address_sanitizer)
#define QUARVEL_SANITIZED
#endif
#elif defined(__SANITIZE_ADDRESS__) || defined(__SANITIZE_THREAD__)
#define QUARVEL_SANITIZED
#endif

namespace quarvel {
namespace {

#ifdef QUARVEL_SANITIZED
constexpr std::size_t kStackBytes = 1024 * 1024;  // a sanitizer's frames are several times as large
#else
constexpr std::size_t kStackBytes = 192 * 1024;
#endif
constexpr std::size_t kNameCharacters = 15;

struct Start {
  std::string name;
  int nice;
  Block body;
};

void* runThread(void* argument) {
  const std::unique_ptr<Start> start(static_cast<Start*>(argument));
  pthread_setname_np(pthread_self(), start->name.c_str());
  if (start->nice != 0) {
    setpriority(PRIO_PROCESS, static_cast<id_t>(gettid()), start->nice);
  }
  start->body();
  return nullptr;
}

/// Blocks the signals that are meant for the process and returns the mask before. Faults of the
/// thread itself and the profiler's signal stay as they were.
sigset_t blockProcessSignals() {
  sigset_t all;
  sigfillset(&all);
  for (const int own : {SIGSEGV, SIGBUS, SIGFPE, SIGILL, SIGTRAP, SIGABRT, SIGSYS, SIGPROF}) {
    sigdelset(&all, own);
  }
  sigset_t before;
  pthread_sigmask(SIG_BLOCK, &all, &before);
  return before;
}

int createThread(pthread_t& thread, int detachState, std::string_view name, int nice, Block body) {
  auto start = std::make_unique<Start>(Start{ThreadName(name), nice, std::move(body)});
  pthread_attr_t attributes;
  pthread_attr_init(&attributes);
  pthread_attr_setdetachstate(&attributes, detachState);
  pthread_attr_setstacksize(&attributes, kStackBytes);
  const sigset_t before = blockProcessSignals();
  const int failure = pthread_create(&thread, &attributes, runThread, start.get());
  pthread_sigmask(SIG_SETMASK, &before, nullptr);
  pthread_attr_destroy(&attributes);
  if (failure == 0) static_cast<void>(start.release());
  return failure;
}

}  // namespace

std::string ThreadName(std::string_view label) {
  std::string_view name = label.substr(label.rfind('.') + 1);
  while (name.size() < label.size()) {
    const std::size_t before = label.size() - name.size() - 1;  // of the dot
    const std::size_t dot = before == 0 ? std::string_view::npos : label.rfind('.', before - 1);
    const std::string_view longer = label.substr(dot + 1);
    if (longer.size() > kNameCharacters) break;
    name = longer;
  }
  return std::string(name.substr(0, kNameCharacters));
}

void NameThisThread(std::string_view label) {
  pthread_setname_np(pthread_self(), ThreadName(label).c_str());
}

int StartThread(std::string_view name, int nice, Block body) {
  pthread_t thread{};
  return createThread(thread, PTHREAD_CREATE_DETACHED, name, nice, std::move(body));
}

int JoinedThread::start(std::string_view name, int nice, Block body) {
  const int failure = createThread(thread_, PTHREAD_CREATE_JOINABLE, name, nice, std::move(body));
  started_ = failure == 0;
  return failure;
}

void JoinedThread::join() {
  if (std::exchange(started_, false)) pthread_join(thread_, nullptr);
}

}  // namespace quarvel
