// GSBitSet: a growing set of bits.
#ifndef GSCL_GSBITSET_H
#define GSCL_GSBITSET_H

#include "gscl/export.h"

namespace zelt_gscl_V1 {

/// Bits numbered from 0, in 32-bit words, the lowest bit first. A bit beyond the end reads as 0; setting or
/// clearing one makes the set just long enough for it. The set only shrinks by eraseall and by copying.
///
/// Threads: no locking; one thread at a time, or several that only read. Ownership: every set has its own words; a
/// copy copies them. Errors: a failed allocation is thrown and leaves the set as it was.
class ZN_GSCL_EXPORT GSBitSet {
 public:
  /// Empty.
  GSBitSet();
  /// As many whole words as nbits bits need, all ones for a value other than 0 (also beyond nbits), else zeros.
  GSBitSet(unsigned int nbits, int value);
  GSBitSet(const GSBitSet& other);
  /// As CopyFrom.
  GSBitSet& operator=(const GSBitSet& other);
  ~GSBitSet();

  /// The capacity in bits, a multiple of 32; INT_MAX when it is more than an int can say.
  int size() const;
  /// The bit, 0 or 1; 0 for a negative index and beyond the end.
  int get(int i) const;
  int operator[](int i) const { return get(i); }
  /// Sets the bit for a value other than 0, else clears it; either grows the set when the bit is beyond the end. A
  /// negative index is ignored.
  void set(int i, int value);
  /// Makes every bit of the capacity 1 for a value other than 0, else 0.
  void fillall(int value);
  /// Frees the words; the capacity is 0.
  void eraseall();
  /// Takes over the other's bits and its exact capacity.
  void CopyFrom(const GSBitSet& other);
  /// 1 when no bit is set, else 0.
  int AreAllZero() const;
  /// 1 when both sets hold the same bits, whatever their capacities, else 0.
  int AreTheySame(const GSBitSet& other) const;

  /// The lowest and the highest index of a bit that is set; -1 when there is none.
  int lowerbound() const;
  int upperbound() const;

 private:
  ZN_GSCL_HIDDEN void prepare(int nwords);

  int _nalloc;          // words allocated
  unsigned int* _data;  // array new, or null
};

}  // namespace zelt_gscl_V1

#endif
