#include "tools/Terminal.h"

#include <sys/ioctl.h>
#include <unistd.h>

#include <cstdlib>
#include <cwchar>

namespace quarvel {
namespace {

struct Character {
  std::size_t bytes = 1;
  int columns = 1;
  bool printable = false;
};

// Marks that reverse the direction of the following text.
bool TurnsText(wchar_t code) {
  return code == 0x200e || code == 0x200f || (code >= 0x202a && code <= 0x202e) ||
         (code >= 0x2066 && code <= 0x2069);
}

// Precondition: there is one.
Character FirstOf(std::string_view text) {
  const auto byte = static_cast<unsigned char>(text.front());
  if (byte < 0x80) return {1, 1, byte >= 0x20 && byte != 0x7f};
  std::mbstate_t state{};
  wchar_t code = 0;
  const std::size_t bytes = std::mbrtowc(&code, text.data(), text.size(), &state);
  if (bytes > text.size()) return {};  // mbrtowc returns its errors as the largest numbers
  const int columns = ::wcwidth(code);
  if (columns < 0 || TurnsText(code)) return {bytes, 1, false};
  return {bytes, columns, true};
}

}  // namespace

Terminal Terminal::standardOutput() {
  Terminal terminal;
  terminal.attached = ::isatty(STDOUT_FILENO) == 1;
  terminal.coloured = WantsColour(STDOUT_FILENO);
  winsize size{};
  if (terminal.attached && ::ioctl(STDOUT_FILENO, TIOCGWINSZ, &size) == 0 && size.ws_col > 0) {
    terminal.columns = size.ws_col;
  }
  return terminal;
}

bool WantsColour(int descriptor) {
  const char* const refused = std::getenv("NO_COLOR");
  return ::isatty(descriptor) == 1 && (refused == nullptr || *refused == '\0');
}

std::size_t ColumnsOf(std::string_view text) {
  std::size_t columns = 0;
  while (!text.empty()) {
    const Character character = FirstOf(text);
    columns += static_cast<std::size_t>(character.columns);
    text.remove_prefix(character.bytes);
  }
  return columns;
}

std::string Fitted(std::string_view text, std::size_t columns) {
  std::size_t used = 0;
  std::size_t kept = 0;  // bytes that leave room for the ellipsis
  for (std::size_t at = 0; at < text.size();) {
    const Character character = FirstOf(text.substr(at));
    used += static_cast<std::size_t>(character.columns);
    if (used > columns) return std::string(text.substr(0, kept)) + "…";
    at += character.bytes;
    if (used < columns) kept = at;
  }
  return std::string(text);
}

std::string Printable(std::string_view text) {
  std::string printable;
  printable.reserve(text.size());
  while (!text.empty()) {
    const Character character = FirstOf(text);
    if (character.printable) {
      printable += text.substr(0, character.bytes);
    } else {
      printable.push_back(' ');
    }
    text.remove_prefix(character.bytes);
  }
  return printable;
}

}  // namespace quarvel
