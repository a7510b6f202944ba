#pragma once

#include <unistd.h>

#include <cstdint>
#include <cstdio>
#include <cstdlib>

/// Standard error as it was when the process began: a fuzzer closes it to the service's log.
inline const int kComplaints = ::dup(STDERR_FILENO);

/// What a fuzz target asserts, in every build.
inline void Require(bool holds, const char* what) {
  if (holds) return;
  ::dprintf(kComplaints, "required: %s\n", what);
  std::abort();
}

/// What libFuzzer and the replay call with each input.
extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size);
