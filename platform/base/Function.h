// A move-only callable: work handed to a queue, a completion, a reply. Up to 48 bytes of captures live inside it, so
// that the road of one event allocates nothing for its closures; larger ones take one heap block. Calling an empty one
// is a bug and is asserted.
#pragma once

#include <cassert>
#include <cstddef>
#include <new>
#include <type_traits>
#include <utility>

namespace kyt {

template <typename Signature>
class Function;

template <typename Result, typename... Arguments>
class Function<Result(Arguments...)> {
 public:
  Function() noexcept = default;
  Function(std::nullptr_t) noexcept {}  // NOLINT(google-explicit-constructor)
  template <typename F, typename D = std::decay_t<F>,
            typename = std::enable_if_t<!std::is_same_v<D, Function> &&
                                        std::is_invocable_r_v<Result, D&, Arguments...>>>
  Function(F&& f) {  // NOLINT(google-explicit-constructor)
    if constexpr (sizeof(D) <= kInline && alignof(D) <= alignof(std::max_align_t) &&
                  std::is_nothrow_move_constructible_v<D>) {
      ::new (static_cast<void*>(storage_)) D(std::forward<F>(f));
      static constexpr Table table = {
          [](void* s, Arguments... a) -> Result {
            return (*std::launder(reinterpret_cast<D*>(s)))(std::forward<Arguments>(a)...);
          },
          [](void* from, void* to) {
            D* d = std::launder(reinterpret_cast<D*>(from));
            if (to != nullptr) ::new (to) D(std::move(*d));
            d->~D();
          }};
      table_ = &table;
    } else {
      ::new (static_cast<void*>(storage_)) D*(new D(std::forward<F>(f)));
      static constexpr Table table = {
          [](void* s, Arguments... a) -> Result {
            return (**std::launder(reinterpret_cast<D**>(s)))(std::forward<Arguments>(a)...);
          },
          [](void* from, void* to) {
            D* d = *std::launder(reinterpret_cast<D**>(from));
            if (to != nullptr) {
              ::new (to) D*(d);
            } else {
              delete d;
            }
          }};
      table_ = &table;
    }
  }
  Function(Function&& other) noexcept { take(other); }
  Function& operator=(Function&& other) noexcept {
    if (this != &other) {
      reset();
      take(other);
    }
    return *this;
  }
  Function(const Function&) = delete;
  Function& operator=(const Function&) = delete;
  ~Function() { reset(); }

  explicit operator bool() const noexcept { return table_ != nullptr; }
  Result operator()(Arguments... arguments) {
    assert(table_ != nullptr);
    return table_->call(storage_, std::forward<Arguments>(arguments)...);
  }
  void reset() noexcept {
    if (table_ != nullptr) std::exchange(table_, nullptr)->moveOrDestroy(storage_, nullptr);
  }

 private:
  static constexpr size_t kInline = 48;
  struct Table {
    Result (*call)(void*, Arguments...);
    void (*moveOrDestroy)(void* from, void* to);
  };
  void take(Function& other) noexcept {
    if (other.table_ == nullptr) return;
    other.table_->moveOrDestroy(other.storage_, storage_);
    table_ = std::exchange(other.table_, nullptr);
  }
  const Table* table_ = nullptr;
  alignas(std::max_align_t) std::byte storage_[kInline];
};

using Task = Function<void()>;

}  // namespace kyt
