#include "platform/FileSystem.h"

#include "base/Files.h"
#include "linux/Service.h"

namespace quarvel {

std::string DiagnosticsPath(std::string_view path) {
  return Service::current().paths().diagnosticsPrefix.native() + std::string(path);
}

Outcome CreateDirectory(std::string_view path, std::uint32_t permissions) {
  return MakeDirectory(path, static_cast<mode_t>(permissions));
}

Outcome WriteFileAtomically(std::string_view path, std::string_view content) {
  return ReplaceFile(path, content);
}

}  // namespace quarvel
