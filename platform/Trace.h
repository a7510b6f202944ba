#pragma once

#include <cstdint>

namespace quarvel {

/// Emits a kernel trace event. From any thread; never blocks. Costs nanoseconds while no tracer is
/// attached.
void EmitKernelTrace(std::uint32_t code, std::uint64_t first = 0, std::uint64_t second = 0,
                     std::uint64_t third = 0, std::uint64_t fourth = 0);

}  // namespace quarvel
