#pragma once

#include <string>
#include <string_view>

#include "base/Block.h"

namespace quarvel {

/// Starts a thread that nobody joins. Its stack is small: enough for the deepest payload, little
/// enough for a thousand threads. Signals meant for the process are blocked in it, so that they
/// reach the threads that wait for them. `nice` is the thread's own nice value; a thread inherits
/// its starter's, and cannot go below it without privilege. Returns 0, or the errno of why no
/// thread could be had.
[[nodiscard]] int StartThread(std::string_view name, int nice, Block body);

/// What the system's tools show as the calling thread's name: one system call.
void NameThisThread(std::string_view label);

/// The 15 characters that the kernel keeps of a thread's name: the last dotted components of
/// `label` that fit, or the beginning of the last one.
[[nodiscard]] std::string ThreadName(std::string_view label);

}  // namespace quarvel
