#include "export/Exporters.h"

#include <utility>

namespace quarvel {

Exporters::Exporters(TelemetryStore& store, std::vector<Backend> backends, bool exports)
    : store_(store) {
  for (Backend& backend : backends) {
    threads_.push_back(std::make_unique<ExportThread>(std::move(backend.options),
                                                      std::move(backend.engine), store_));
  }
  setExports(exports);
  for (const auto& thread : threads_) thread->start();
  store_.followDurableExtent([this](const DurableExtent& extent) {
    for (const auto& thread : threads_) thread->extend(extent);
  });
}

Exporters::~Exporters() {
  store_.followDurableExtent({});
}

void Exporters::setExports(bool exports) {
  const MutexLock lock(mutex_);
  if (std::exchange(exports_, exports) == exports) return;
  if (exports) {
    release();
  } else {
    hold();
  }
}

void Exporters::hold() {
  for (const auto& thread : threads_) thread->hold();
}

void Exporters::release() {
  for (const auto& thread : threads_) thread->release();
}

void Exporters::stop(std::chrono::steady_clock::time_point deadline) {
  store_.followDurableExtent({});
  for (const auto& thread : threads_) thread->stop();
  for (const auto& thread : threads_) static_cast<void>(thread->awaitEnd(deadline));
}

Exporters::Hold::Hold(Exporters& exporters) : exporters_(exporters) {
  exporters_.hold();
}

Exporters::Hold::~Hold() {
  exporters_.release();
}

}  // namespace quarvel
