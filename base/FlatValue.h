#pragma once

#include "base/Value.h"

namespace quarvel {

/// The value of a TOML node, as preferences allow it: a string, a number or a boolean; nil for
/// every other kind. A template, since base includes no TOML library.
template <class Node>
[[nodiscard]] Value FlatValue(const Node& node) {
  if (const auto* text = node.as_string()) return text->get();
  if (const auto* integer = node.as_integer()) return integer->get();
  if (const auto* real = node.as_floating_point()) return real->get();
  if (const auto* boolean = node.as_boolean()) return boolean->get();
  return nullptr;
}

}  // namespace quarvel
