#include "export/ExportEngine.h"

#include <dlfcn.h>
#include <fmt/format.h>

#include <filesystem>
#include <system_error>
#include <utility>

namespace quarvel {

namespace {

/// Takes nothing. The reason may be mended while the rows wait in the store.
class MissingEngine final : public ExportEngine {
 public:
  explicit MissingEngine(std::string reason) : reason_(std::move(reason)) {}

  [[nodiscard]] Delivery deliver(const ExportBatch& /*batch*/) override {
    return {.remainder = Delivery::Remainder::again, .reason = reason_};
  }
  void disconnect() override {}
  void stop() override {}
  void resume() override {}

 private:
  const std::string reason_;
};

/// The installed module, relative to the service's program; before installation, beside the
/// program.
std::filesystem::path ModulePath(const std::string& backend) {
  std::error_code error;
  const auto service = std::filesystem::read_symlink("/proc/self/exe", error).parent_path();
  const std::string name = fmt::format("export-{}.so", backend);
  const std::filesystem::path installed = service / QUARVEL_MODULES / name;
  return std::filesystem::exists(installed, error) ? installed : service / name;
}

}  // namespace

std::unique_ptr<ExportEngine> LoadEngine(const std::string& backend,
                                         const BackendSettings& settings,
                                         const ExportDevice& device) {
  // Never closed: its threads may be running until the process is gone.
  void* const module = ::dlopen(ModulePath(backend).c_str(), RTLD_NOW | RTLD_LOCAL);
  void* const entry = module == nullptr ? nullptr : ::dlsym(module, kEngineModuleEntry);
  if (entry == nullptr) {
    return std::make_unique<MissingEngine>(
        fmt::format("the part of the service for it cannot be loaded: {}", ::dlerror()));
  }
  return std::unique_ptr<ExportEngine>(reinterpret_cast<MakeEngine>(entry)(settings, device));
}

}  // namespace quarvel
