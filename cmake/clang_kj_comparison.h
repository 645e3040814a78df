#pragma once

// Force-included for clang only. kj 0.9 leaves its comparisons with a C string on the left out when
// the compiler has operator<=>, counting on `a == b` being rewritten as `b == a`. Clang follows the
// later rule: a class that also declares operator!= is not rewritten, so capnp's own headers do not
// compile. These are the operators left out. They are templates, so that nothing is included here
// and nothing of kj shows in files that do not use it; the operator!= keeps clang from rewriting
// the operator== into a call of itself.
#if defined(__clang__) && defined(__cplusplus) && defined(__cpp_impl_three_way_comparison)
namespace kj {

class StringPtr;
class String;

template <typename S>
  requires(__is_same(S, StringPtr) || __is_same(S, String))
inline bool operator==(const char* a, const S& b) {
  return b.operator==(a);
}

template <typename S>
  requires(__is_same(S, StringPtr) || __is_same(S, String))
inline bool operator!=(const char* a, const S& b) {
  return b.operator!=(a);
}

}  // namespace kj
#endif
