#pragma once

#include <concepts>
#include <cstddef>
#include <memory>
#include <new>
#include <type_traits>
#include <utility>

namespace quarvel {

class Block;

/// A callable that a block can hold.
template <class F>
concept BlockWork = !std::same_as<std::remove_cvref_t<F>, Block> && std::is_invocable_v<F&>;

/// A piece of work to be run once: a callable without arguments or result, moved and never copied,
/// so that it can own its data. Callables of up to `kInlineBytes` are held in place, without an
/// allocation. Owned by one queue or timer at a time; not synchronised.
class Block {
 public:
  /// Room for the lambda of a call: a reply, a few arguments and the objects that it keeps alive.
  static constexpr std::size_t kInlineBytes = 88;

  Block() = default;
  /// Takes the callable over. Allocates when it is larger than `kInlineBytes`, or its move may
  /// throw.
  template <BlockWork F>
  Block(F&& work) {  // NOLINT(google-explicit-constructor): a lambda is a block
    using Work = std::remove_cvref_t<F>;
    if constexpr (fitsInPlace<Work>()) {
      ::new (static_cast<void*>(storage_)) Work(std::forward<F>(work));
      operations_ = &kInPlace<Work>;
    } else {
      ::new (static_cast<void*>(storage_)) Work*(new Work(std::forward<F>(work)));
      operations_ = &kOnHeap<Work>;
    }
  }
  // A moved-from block is empty. Assigning destroys the callable that the target held, without
  // running it.
  Block(Block&& other) noexcept { take(other); }
  Block& operator=(Block&& other) noexcept {
    if (this != &other) {
      reset();
      take(other);
    }
    return *this;
  }
  Block(const Block&) = delete;
  Block& operator=(const Block&) = delete;
  ~Block() { reset(); }

  /// False when there is nothing to run: made empty, or moved from.
  explicit operator bool() const { return operations_ != nullptr; }
  /// Runs the callable on the calling thread. The callable stays until the block is destroyed or
  /// assigned. Precondition: there is something to run. An exception of the callable passes
  /// through.
  void operator()() { operations_->run(storage_); }

 private:
  /// The operations on the callable's type, as the block itself does not know it.
  struct Operations {
    void (*run)(void* storage);
    void (*move)(void* from, void* to);  // leaves nothing to destroy at `from`
    void (*destroy)(void* storage);
  };

  /// A callable whose move may throw goes on the heap, since moving a block never throws.
  template <class Work>
  static constexpr bool fitsInPlace() {
    return sizeof(Work) <= kInlineBytes && alignof(Work) <= alignof(std::max_align_t) &&
           std::is_nothrow_move_constructible_v<Work>;
  }
  /// For a callable that lies in `storage_` itself.
  template <class Work>
  static constexpr Operations kInPlace = {
      [](void* storage) { (*static_cast<Work*>(storage))(); },
      [](void* from, void* to) {
        ::new (to) Work(std::move(*static_cast<Work*>(from)));
        std::destroy_at(static_cast<Work*>(from));
      },
      [](void* storage) { std::destroy_at(static_cast<Work*>(storage)); }};
  /// For a callable whose address lies in `storage_`.
  template <class Work>
  static constexpr Operations kOnHeap = {
      [](void* storage) { (**static_cast<Work**>(storage))(); },
      [](void* from, void* to) { ::new (to) Work*(*static_cast<Work**>(from)); },
      [](void* storage) { delete *static_cast<Work**>(storage); }};

  /// Precondition: this block is empty. Leaves `other` empty.
  void take(Block& other) noexcept {
    operations_ = std::exchange(other.operations_, nullptr);
    if (operations_ != nullptr) operations_->move(other.storage_, storage_);
  }
  /// Destroys the callable. The block is empty already meanwhile, should a destructor look.
  void reset() noexcept {
    if (operations_ != nullptr) std::exchange(operations_, nullptr)->destroy(storage_);
  }

  const Operations* operations_ = nullptr;  // null: nothing to run
  alignas(std::max_align_t) std::byte storage_[kInlineBytes];
};

}  // namespace quarvel
