#include "export/ExportThread.h"

#include <fmt/format.h>

#include <utility>

#include "queues/Thread.h"

namespace quarvel {

ExportThread::ExportThread(Exporter::Options options, std::unique_ptr<ExportEngine> engine,
                           TelemetryStore& store)
    : backend_(options.backend),
      engine_(std::move(engine)),
      source_(store, store.path(), backend_),
      exporter_(std::move(options), source_, *engine_) {}

ExportThread::~ExportThread() {
  stop();
  if (thread_.joinable()) thread_.join();
}

void ExportThread::start() {
  const MutexLock lock(mutex_);
  parked_ = ended_ = false;
  thread_ = std::thread([this] {
    NameThisThread(fmt::format("quarvel.{}", backend_));
    run();
  });
}

void ExportThread::extend(const DurableExtent& extent) {
  const MutexLock lock(mutex_);
  extent_ = extent;
  extended_ = true;
  changed_.notifyAll();
}

void ExportThread::hold() {
  const MutexLock lock(mutex_);
  ++holds_;
  stopWork();
  while (!parked_ && !ended_) changed_.wait(mutex_);
}

void ExportThread::release() {
  const MutexLock lock(mutex_);
  if (--holds_ > 0 || stopping_) return;
  engine_->resume();
  source_.resume();
  changed_.notifyAll();
}

void ExportThread::stop() {
  const MutexLock lock(mutex_);
  stopping_ = true;
  stopWork();
}

void ExportThread::stopWork() {
  engine_->stop();
  source_.stop();
  changed_.notifyAll();
}

bool ExportThread::awaitEnd(std::chrono::steady_clock::time_point deadline) {
  {
    const MutexLock lock(mutex_);
    while (!ended_) {
      if (!changed_.waitUntil(mutex_, deadline)) break;
    }
    if (!ended_) return false;
  }
  if (thread_.joinable()) thread_.join();  // its function has returned or is about to
  return true;
}

ExportStatus ExportThread::status() const {
  ExportStatus status = exporter_.status();
  const MutexLock lock(mutex_);
  status.wakeUps = wakeUps_;
  return status;
}

void ExportThread::run() {
  Exporter::Next next{Exporter::Instant{}, false};
  mutex_.lock();
  while (awaitWork(next)) {
    ++wakeUps_;
    extended_ = false;
    const DurableExtent extent = extent_;
    mutex_.unlock();
    next = exporter_.step(extent);
    mutex_.lock();
  }
  ended_ = true;
  changed_.notifyAll();
  mutex_.unlock();
}

bool ExportThread::awaitWork(const Exporter::Next& next) {
  for (;;) {
    if (stopping_) return false;
    if (holds_ > 0) {
      park();
      continue;
    }
    if (next.uponRows && extended_) return true;
    if (!next.at) {
      changed_.wait(mutex_);
    } else if (!changed_.waitUntil(mutex_, *next.at)) {
      if (!stopping_ && holds_ == 0) return true;
    }
  }
}

void ExportThread::park() {
  mutex_.unlock();
  engine_->disconnect();
  mutex_.lock();
  parked_ = true;
  changed_.notifyAll();
  while (holds_ > 0 && !stopping_) changed_.wait(mutex_);
  parked_ = false;
}

}  // namespace quarvel
