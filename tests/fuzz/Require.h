#pragma once

#include <unistd.h>

#include <cstdint>
#include <cstdio>
#include <cstdlib>

/// A copy of standard error, which run.py has libFuzzer close because the service logs there.
inline const int kComplaints = ::dup(STDERR_FILENO);

/// An assertion of a fuzz target, in every build: prints the requirement and aborts.
inline void Require(bool holds, const char* requirement) {
  if (holds) return;
  ::dprintf(kComplaints, "required: %s\n", requirement);
  std::abort();
}

/// Runs one input; called by libFuzzer and by replay.cc.
extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size);
