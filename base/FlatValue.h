#pragma once

#include "base/Value.h"

namespace quarvel {

/// The value of a TOML node, as preferences allow it: a string, a number or a boolean; nil for
/// every other kind, which the caller reports with its line. The text is copied. A template over
/// the library's node type, since base includes no TOML library: the service and the tools read the
/// same files with it. May be called from any thread.
template <class Node>
[[nodiscard]] Value FlatValue(const Node& node) {
  if (const auto* text = node.as_string()) return text->get();
  if (const auto* integer = node.as_integer()) return integer->get();
  if (const auto* real = node.as_floating_point()) return real->get();
  if (const auto* boolean = node.as_boolean()) return boolean->get();
  return nullptr;
}

}  // namespace quarvel
