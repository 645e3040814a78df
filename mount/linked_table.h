#pragma once

#include <cstddef>
#include <cstdint>
#include <vector>

namespace yomber {

/// A hash table of objects that are linked through a member of theirs: each costs no memory beside
/// its place in an array. It owns none of them.
///
/// `Key::hash(x)` is that of an object or of what one is sought by, and `Key::isSame(object, x)`
/// whether that is it. What an object is found by must not change while it is here.
template <typename Object, Object* Object::* kNext, typename Key>
class LinkedTable {
 public:
  LinkedTable() : chains_(std::size_t{1} << kFewest) {}

  [[nodiscard]] std::size_t size() const { return size_; }

  template <typename Sought>
  [[nodiscard]] Object* find(const Sought& sought) const {
    Object* object = chains_[chainOf(sought)];
    while (object != nullptr && !Key::isSame(*object, sought)) object = object->*kNext;
    return object;
  }

  /// It is in no table through that member.
  void insert(Object& object) {
    if (size_ >= chains_.size()) grow();
    link(object);
    ++size_;
  }

  /// False when it is not here.
  bool erase(Object& object) {
    for (Object** at = &chains_[chainOf(object)]; *at != nullptr; at = &((*at)->*kNext)) {
      if (*at != &object) continue;
      *at = object.*kNext;
      object.*kNext = nullptr;
      --size_;
      return true;
    }
    return false;
  }

  /// `use` may end each object, but not change the table.
  template <typename Use>
  void forEach(const Use& use) const {
    for (Object* object : chains_) {
      while (object != nullptr) {
        Object* const next = object->*kNext;
        use(*object);
        object = next;
      }
    }
  }

 private:
  static constexpr unsigned kFewest = 6;  ///< chains, as a power of two

  /// The hash may be the number itself, whose low bits tell little: it is spread first.
  template <typename Any>
  [[nodiscard]] std::size_t chainOf(const Any& any) const {
    constexpr std::uint64_t kSpread = 0x9e37'79b9'7f4a'7c15;
    return (static_cast<std::uint64_t>(Key::hash(any)) * kSpread) >> shift_;
  }

  void link(Object& object) {
    Object*& first = chains_[chainOf(object)];
    object.*kNext = first;
    first = &object;
  }

  void grow() {
    std::vector<Object*> before(chains_.size() * 2);
    before.swap(chains_);
    --shift_;
    for (Object* object : before) {
      while (object != nullptr) {
        Object* const next = object->*kNext;
        link(*object);
        object = next;
      }
    }
  }

  std::vector<Object*> chains_;
  unsigned shift_ = 64 - kFewest;
  std::size_t size_ = 0;
};

}  // namespace yomber
