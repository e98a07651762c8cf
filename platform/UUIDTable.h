// UUIDTable<V>: a hash table from random UUIDs to values, kept in one flat
// array (open addressing, linear probing, at most half full).
//
// Made for tables that many short-lived entries pass through, such as the
// keep-alive transactions of a busy daemon: tens of thousands live at once,
// each looked up twice. A lookup touches one cache line, where a node-based
// map chases a pointer to a separately allocated node. Removal shifts the
// entries that follow back (no tombstones), and the array shrinks again
// once it is mostly empty, so a burst leaves no large table behind.
//
// The nil UUID (all zero bits, which UUID::random() never makes) marks a
// free slot and cannot be a key. Not thread-safe: its owner serializes use.
// `Hash` is there for tests, to force colliding keys.
#pragma once

#include <cstddef>
#include <functional>
#include <utility>
#include <vector>

#include "platform/Misuse.h"
#include "platform/UUID.h"

namespace platform {

template <class V, class Hash = std::hash<UUID>>
class UUIDTable {
 public:
  std::size_t size() const { return size_; }
  bool empty() const { return size_ == 0; }

  // The value for `key`, or nullptr. Valid until the table changes.
  V* find(const UUID& key) {
    if (size_ == 0) return nullptr;
    for (std::size_t i = home(key);; i = next(i)) {
      if (slots_[i].key == key) return &slots_[i].value;
      if (isFree(slots_[i])) return nullptr;
    }
  }
  bool contains(const UUID& key) { return find(key) != nullptr; }

  void insertOrAssign(const UUID& key, V value) {
    QV_MISUSE(key == UUID(), "the nil UUID cannot be a key of a UUIDTable");
    if (V* existing = find(key)) {
      *existing = std::move(value);
      return;
    }
    if ((size_ + 1) * 2 > slots_.size()) resize(slots_.empty() ? kMinimumSlots : slots_.size() * 2);
    place(key, std::move(value));
    ++size_;
  }

  // Whether `key` was there.
  bool erase(const UUID& key) {
    if (size_ == 0) return false;
    std::size_t hole = home(key);
    while (!(slots_[hole].key == key)) {
      if (isFree(slots_[hole])) return false;
      hole = next(hole);
    }
    // Shift back each following entry of the run whose home slot does not
    // lie after the hole, so that every entry stays reachable from its home.
    for (std::size_t i = next(hole); !isFree(slots_[i]); i = next(i)) {
      const std::size_t wanted = home(slots_[i].key);
      const bool between =
          hole <= i ? (hole < wanted && wanted <= i) : (hole < wanted || wanted <= i);
      if (between) continue;
      slots_[hole] = std::move(slots_[i]);
      hole = i;
    }
    slots_[hole] = Slot{};
    --size_;
    if (slots_.size() > kMinimumSlots && size_ * 8 < slots_.size()) resize(slots_.size() / 2);
    return true;
  }

  // Calls f(key, value) for every entry, in no particular order. f must not
  // change the table.
  template <class F>
  void forEach(F&& f) {
    for (Slot& slot : slots_) {
      if (!isFree(slot)) f(std::as_const(slot.key), slot.value);
    }
  }

 private:
  struct Slot {
    UUID key;
    V value{};
  };
  static constexpr std::size_t kMinimumSlots = 16;

  static bool isFree(const Slot& slot) { return slot.key == UUID(); }
  std::size_t home(const UUID& key) const { return Hash{}(key) & (slots_.size() - 1); }
  std::size_t next(std::size_t i) const { return (i + 1) & (slots_.size() - 1); }

  void place(const UUID& key, V value) {
    std::size_t i = home(key);
    while (!isFree(slots_[i])) i = next(i);
    slots_[i] = Slot{key, std::move(value)};
  }

  void resize(std::size_t slots) {
    std::vector<Slot> old(slots);
    old.swap(slots_);
    for (Slot& slot : old) {
      if (!isFree(slot)) place(slot.key, std::move(slot.value));
    }
  }

  std::vector<Slot> slots_;
  std::size_t size_ = 0;
};

}  // namespace platform
