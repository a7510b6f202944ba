#include <cstring>
#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "base/MessagePack.h"
#include "base/Utf8.h"
#include "client/c/Boundary.h"

using quarvel::Date;
using quarvel::MessagePackScanner;
using quarvel::MessagePackWriter;
using quarvel::PayloadValue;

/// A dictionary that is being built: the open containers, each with its values so far. One thread
/// at a time.
struct quarvel_payload {
 public:
  /// The service's bound of 32, less the message and its list of arguments.
  static constexpr unsigned kDeepest = 30;

  [[nodiscard]] quarvel_status status() const { return status_; }

  void clear() {
    open_.resize(1);
    open_.front().reset(false);
    numberKey_.reset();
    whole_.reset();
    status_ = QUARVEL_OK;
  }

  template <class Write>
  quarvel_status append(const char* key, Write&& write) {
    return step([&] {
      if (!beginValue(key)) return false;
      MessagePackWriter writer(open_.back().body);
      return write(writer);
    });
  }

  quarvel_status open(const char* key, bool list) {
    return step([&] {
      if (open_.size() >= kDeepest || !beginValue(key)) return false;
      open_.emplace_back().reset(list);
      return true;
    });
  }

  quarvel_status close() {
    return step([&] {
      if (open_.size() == 1 || numberKey_) return false;
      const Container closed = std::move(open_.back());
      open_.pop_back();
      closed.write(open_.back().body);
      return true;
    });
  }

  quarvel_status setNumberKey(std::int64_t key) {
    return step([&] {
      if (open_.back().list || numberKey_) return false;
      numberKey_ = key;
      return true;
    });
  }

  quarvel_status assign(std::string_view encoded) {
    clear();
    return step([&] {
      MessagePackScanner scanner(encoded.size(), kDeepest);
      if (scanner.scan(encoded) != MessagePackScanner::Progress::complete ||
          scanner.length() != encoded.size()) {
        return false;
      }
      const auto payload = quarvel::Payload::from(PayloadValue(encoded.data()));
      if (!payload) return false;
      for (const quarvel::PayloadEntry& entry : payload.value()) {
        open_.front().body.append(entry.key.encoded()).append(entry.value.encoded());
        ++open_.front().count;
      }
      return true;
    });
  }

  /// The finished payload, kept until the next step; null while it is not whole.
  [[nodiscard]] const quarvel::Payload* whole() const {
    if (status_ != QUARVEL_OK || open_.size() != 1 || numberKey_) return nullptr;
    if (!whole_) {
      std::string encoded;
      open_.front().write(encoded);
      auto payload = quarvel::Payload::from(PayloadValue(encoded.data()));
      if (!payload) return nullptr;
      whole_ = std::move(payload.value());
    }
    return &*whole_;
  }

 private:
  struct Container {
    std::string body;
    std::size_t count = 0;
    bool list = false;

    void reset(bool isList) {
      body.clear();
      count = 0;
      list = isList;
    }
    void write(std::string& out) const {
      MessagePackWriter writer(out);
      if (list) {
        writer.list(count);
      } else {
        writer.dictionary(count);
      }
      writer.encoded(body);
    }
  };

  // A step that fails, or throws, leaves the payload in the state of having failed.
  template <class Step>
  quarvel_status step(Step&& body) noexcept {
    if (status_ != QUARVEL_OK) return status_;
    status_ = quarvel::c::Guard([&] {
      whole_.reset();
      return body() ? QUARVEL_OK : QUARVEL_INVALID_PAYLOAD;
    });
    return status_;
  }

  // Begins a value: writes its key in a dictionary, and counts it.
  bool beginValue(const char* key) {
    Container& container = open_.back();
    const bool keyed = key != nullptr || numberKey_.has_value();
    if (keyed == container.list || (key != nullptr && numberKey_)) return false;
    MessagePackWriter writer(container.body);
    if (key != nullptr) {
      if (!quarvel::IsUtf8(key)) return false;
      writer.string(key);
    } else if (numberKey_) {
      writer.integer(*std::exchange(numberKey_, std::nullopt));
    }
    ++container.count;
    return true;
  }

  std::vector<Container> open_{1};
  std::optional<std::int64_t> numberKey_;
  quarvel_status status_ = QUARVEL_OK;
  mutable std::optional<quarvel::Payload> whole_;
};

quarvel_status quarvel_payload_read(const quarvel_payload* payload, const quarvel::Payload*& read) {
  read = payload->whole();
  if (read != nullptr) return QUARVEL_OK;
  return payload->status() == QUARVEL_OK ? QUARVEL_INVALID_PAYLOAD : payload->status();
}

quarvel_payload* quarvel_payload_new(void) {
  quarvel_payload* payload = nullptr;
  quarvel::c::Guard([&] {
    payload = new quarvel_payload;
    return QUARVEL_OK;
  });
  return payload;
}

void quarvel_payload_free(quarvel_payload* payload) {
  delete payload;
}

void quarvel_payload_clear(quarvel_payload* payload) {
  if (payload != nullptr) payload->clear();
}

quarvel_status quarvel_payload_status(const quarvel_payload* payload) {
  if (payload == nullptr) return QUARVEL_INVALID_ARGUMENT;
  return quarvel::c::Guard([&] {
    const quarvel::Payload* whole = nullptr;
    return quarvel_payload_read(payload, whole);
  });
}

namespace {

template <class Write>
quarvel_status Append(quarvel_payload* payload, const char* key, Write&& write) {
  if (payload == nullptr) return QUARVEL_INVALID_ARGUMENT;
  return payload->append(key, [&](MessagePackWriter& writer) {
    write(writer);
    return true;
  });
}

}  // namespace

quarvel_status quarvel_payload_nil(quarvel_payload* payload, const char* key) {
  return Append(payload, key, [](MessagePackWriter& writer) { writer.nil(); });
}

quarvel_status quarvel_payload_boolean(quarvel_payload* payload, const char* key, bool value) {
  return Append(payload, key, [=](MessagePackWriter& writer) { writer.boolean(value); });
}

quarvel_status quarvel_payload_integer(quarvel_payload* payload, const char* key, int64_t value) {
  return Append(payload, key, [=](MessagePackWriter& writer) { writer.integer(value); });
}

quarvel_status quarvel_payload_unsigned(quarvel_payload* payload, const char* key, uint64_t value) {
  return Append(payload, key, [=](MessagePackWriter& writer) { writer.unsignedInteger(value); });
}

quarvel_status quarvel_payload_real(quarvel_payload* payload, const char* key, double value) {
  return Append(payload, key, [=](MessagePackWriter& writer) { writer.real(value); });
}

quarvel_status quarvel_payload_string(quarvel_payload* payload, const char* key, const char* text) {
  if (payload == nullptr || text == nullptr) return QUARVEL_INVALID_ARGUMENT;
  return payload->append(key, [=](MessagePackWriter& writer) {
    if (!quarvel::IsUtf8(text)) return false;
    writer.string(text);
    return true;
  });
}

quarvel_status quarvel_payload_bytes(quarvel_payload* payload, const char* key, const void* bytes,
                                     size_t size) {
  if (bytes == nullptr && size > 0) return QUARVEL_INVALID_ARGUMENT;
  return Append(payload, key, [=](MessagePackWriter& writer) {
    writer.bytes({static_cast<const char*>(bytes), size});
  });
}

quarvel_status quarvel_payload_date(quarvel_payload* payload, const char* key,
                                    int64_t microseconds) {
  if (payload == nullptr) return QUARVEL_INVALID_ARGUMENT;
  const Date date{std::chrono::microseconds(microseconds)};
  return payload->append(key, [=](MessagePackWriter& writer) {
    if (date < quarvel::kEarliestDate || date > quarvel::kLatestDate) return false;
    writer.date(date);
    return true;
  });
}

quarvel_status quarvel_payload_open_dictionary(quarvel_payload* payload, const char* key) {
  return payload == nullptr ? QUARVEL_INVALID_ARGUMENT : payload->open(key, false);
}

quarvel_status quarvel_payload_open_list(quarvel_payload* payload, const char* key) {
  return payload == nullptr ? QUARVEL_INVALID_ARGUMENT : payload->open(key, true);
}

quarvel_status quarvel_payload_close(quarvel_payload* payload) {
  return payload == nullptr ? QUARVEL_INVALID_ARGUMENT : payload->close();
}

quarvel_status quarvel_payload_number_key(quarvel_payload* payload, int64_t key) {
  return payload == nullptr ? QUARVEL_INVALID_ARGUMENT : payload->setNumberKey(key);
}

quarvel_status quarvel_payload_assign(quarvel_payload* payload, const void* message_pack,
                                      size_t size) {
  if (payload == nullptr || message_pack == nullptr) return QUARVEL_INVALID_ARGUMENT;
  return payload->assign({static_cast<const char*>(message_pack), size});
}
