#include "platform/Trace.h"

#include <sys/sdt.h>

namespace quarvel {

// A no-operation that tracing tools replace while they watch; its place and its arguments stand in
// a note of the binary.
void EmitKernelTrace(std::uint32_t code, std::uint64_t first, std::uint64_t second,
                     std::uint64_t third, std::uint64_t fourth) {
  DTRACE_PROBE5(quarvel, event, code, first, second, third, fourth);
}

}  // namespace quarvel
