#include "tools/Terminal.h"

#include <sys/ioctl.h>
#include <unistd.h>

#include <algorithm>
#include <cstdlib>

namespace quarvel {
namespace {

bool BeginsCharacter(char byte) {
  return (static_cast<unsigned char>(byte) & 0xc0) != 0x80;
}

}  // namespace

Terminal Terminal::standardOutput() {
  Terminal terminal;
  terminal.attached = ::isatty(STDOUT_FILENO) == 1;
  terminal.coloured = terminal.attached && std::getenv("NO_COLOR") == nullptr;
  winsize size{};
  if (terminal.attached && ::ioctl(STDOUT_FILENO, TIOCGWINSZ, &size) == 0 && size.ws_col > 0) {
    terminal.columns = size.ws_col;
  }
  return terminal;
}

std::size_t ColumnsOf(std::string_view text) {
  return static_cast<std::size_t>(std::count_if(text.begin(), text.end(), BeginsCharacter));
}

std::string Fitted(std::string_view text, std::size_t columns) {
  if (ColumnsOf(text) <= columns) return std::string(text);
  std::size_t end = 0;
  for (std::size_t kept = 0; end < text.size(); ++end) {
    if (BeginsCharacter(text[end]) && ++kept == columns) break;
  }
  return std::string(text.substr(0, end)) + "…";
}

std::string Printable(std::string_view text) {
  std::string printable;
  printable.reserve(text.size());
  for (const char byte : text) {
    const auto code = static_cast<unsigned char>(byte);
    printable.push_back(code < 0x20 || code == 0x7f ? ' ' : byte);
  }
  return printable;
}

}  // namespace quarvel
