// GSLocalVar<char>: a heap buffer that lives as long as its scope.
#ifndef GSCL_GSLOCALVAR_H
#define GSCL_GSLOCALVAR_H

#include <stddef.h>

#include "gscl/export.h"

namespace zelt_gscl_V1 {

template <class T>
class GSLocalVar;

/// A buffer of characters, not initialised, freed with the object.
///
/// Threads: no locking; one thread at a time. Errors: a failed allocation is thrown and leaves the object without
/// a buffer. The object owns its buffer alone and cannot be copied; pointers into it end with the next allocate,
/// deallocate or the object.
template <>
class ZN_GSCL_EXPORT GSLocalVar<char> {
 public:
  /// A buffer of n bytes; none for 0.
  explicit GSLocalVar(unsigned int n);
  ~GSLocalVar();
  GSLocalVar(const GSLocalVar&) = delete;
  GSLocalVar& operator=(const GSLocalVar&) = delete;

  /// Frees the buffer and takes a new one of n bytes (none for 0). Contents are not kept.
  void allocate(unsigned int n);
  /// Frees the buffer.
  void deallocate();
  /// Fills the buffer with zero bytes; its size stays.
  void erase();

  /// Bytes in the buffer, 0 when there is none.
  unsigned int size() const;
  /// The buffer, null when there is none.
  char* data();
  const char* data() const;
  operator char*();
  /// True when there is no buffer.
  bool operator!() const;
  /// The byte at i, which is below size(); not checked.
  char& operator[](ptrdiff_t i);
  const char& operator[](ptrdiff_t i) const;

 private:
  char* _data;
  unsigned int _size;
};

}  // namespace zelt_gscl_V1

#endif
