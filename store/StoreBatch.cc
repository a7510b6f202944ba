#include "store/StoreBatch.h"

namespace quarvel {

namespace {

// Memory for texts beyond 1 MiB is freed after a burst of long ones.
constexpr std::size_t kKeptText = 1 << 20;

// The part of a row whose length is not in `texts`; null when there is none.
const Payload* PayloadOf(const AgentSessionRow& row) {
  return &row.userInfo;
}
const Payload* PayloadOf(const FlushRow&) {
  return nullptr;
}
const Payload* PayloadOf(const ExportedRow&) {
  return nullptr;
}
const Payload* PayloadOf(const ErasureRow&) {
  return nullptr;
}
const Payload* PayloadOf(const auto& row) {
  return &row.payload;
}

}  // namespace

void StoreBatch::clear() {
  rows_.clear();
  text_.clear();
  if (text_.capacity() > kKeptText) text_.shrink_to_fit();
  isLast = false;
}

std::size_t StoreBatch::bytes(const StoreRow& row) {
  return std::visit(
      [](const auto& known) {
        std::size_t bytes = sizeof(StoreRow);
        for (const TextSpan span : known.texts) bytes += span.length;
        if (const Payload* payload = PayloadOf(known)) bytes += payload->encoded().size();
        return bytes;
      },
      row);
}

const std::function<void(const std::optional<Error>&)>* StoreBatch::completion(
    const StoreRow& row) {
  if (const auto* flush = std::get_if<FlushRow>(&row)) return &flush->completion;
  if (const auto* exported = std::get_if<ExportedRow>(&row)) return &exported->completion;
  return nullptr;
}

bool StoreBatch::isCounted(const StoreRow& row) {
  // Rows of clients alone: neither sessions nor requests to the writer.
  return !std::holds_alternative<AgentSessionRow>(row) &&
         !std::holds_alternative<ErasureRow>(row) && completion(row) == nullptr;
}

}  // namespace quarvel
