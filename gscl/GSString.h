// GSString: an owned text whose allocated size is kept apart from its length.
#ifndef GSCL_GSSTRING_H
#define GSCL_GSSTRING_H

#include <type_traits>

#include "gscl/export.h"

namespace zelt_gscl_V1 {

/// A NUL-terminated text on the heap, or nothing at all: an empty object has no storage and its pointer is null,
/// which is not the same as holding the text "".
///
/// Storage never shrinks while a text is assigned or appended, so a string created large enough takes later texts
/// without an allocation. Threads: no locking; one thread at a time, or several that only read. Ownership: every
/// object has its own storage; a copy copies the text. Arguments are copied and may be the object itself or point
/// into its text. Errors: a failed allocation is thrown; storage that was being replaced is gone then and the
/// object empty. Pointers into the text end with the next change and with the object.
class ZN_GSCL_EXPORT GSString {
 public:
  /// Empty, without storage.
  GSString();
  /// n bytes of storage, all zero; none when n is below 1.
  explicit GSString(int n);
  /// A copy of the text; empty for null.
  GSString(const char* s);
  /// A copy of the other's text, in storage of exactly that size; empty when the other has no storage.
  GSString(const GSString& o);
  ~GSString();

  /// Takes over the text as set_string(s, 0) does.
  GSString& operator=(const char* s);
  GSString& operator=(const GSString& o);

  /// Appends; nothing for null. Storage that is too small is replaced by exactly what the new text needs.
  GSString& operator+=(const char* s);
  GSString& operator+=(const GSString& o);

  /// Takes over at most `len` characters of s, all of it when len is below 1. Null frees the storage. Storage
  /// smaller than the whole of s with its terminator is replaced by exactly that many bytes, also when len cuts s
  /// short.
  void set_string(const char* s, int len);

  /// The text, null when there is no storage. Whoever writes through it keeps a NUL within size() bytes.
  operator char*();
  operator const char*() const;
  /// Bytes allocated.
  int size() const;
  /// Characters up to the first NUL, 0 without storage.
  int length() const;

 private:
  void allocate(int n);
  void deallocate();

  char* _area;
  int _size;
};

/// A new string with a's text followed by s; a copy of `a` when s is null.
ZN_GSCL_EXPORT GSString operator+(const GSString& a, const char* s);

/// Whether the texts are equal. A string without storage equals only a null pointer.
ZN_GSCL_EXPORT bool operator==(const GSString& a, const char* s);

// Without these, comparing with a string or a char* would be ambiguous and != would compare addresses. The
// template takes nothing but char*, so that a null pointer constant still means const char*.
inline bool operator==(const GSString& a, const GSString& b) { return a == static_cast<const char*>(b); }
inline bool operator!=(const GSString& a, const char* s) { return !(a == s); }
inline bool operator!=(const GSString& a, const GSString& b) { return !(a == b); }
template <class C>
typename std::enable_if<std::is_same<C, char>::value, bool>::type operator==(const GSString& a, C* s) {
  return a == static_cast<const char*>(s);
}
template <class C>
typename std::enable_if<std::is_same<C, char>::value, bool>::type operator!=(const GSString& a, C* s) {
  return !(a == static_cast<const char*>(s));
}

}  // namespace zelt_gscl_V1

#endif
