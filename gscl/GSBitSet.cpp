#include "gscl/GSBitSet.h"

#include <limits.h>
#include <stdint.h>

#include <algorithm>
#include <bit>

namespace zelt_gscl_V1 {

namespace {

constexpr int kWordBits = 32;

unsigned int bitOf(int i) { return 1U << (i & (kWordBits - 1)); }

// A copy of the first `used` words with zeros behind them; null for no words.
unsigned int* cloneWords(const unsigned int* words, int used, int total) {
  if (total == 0) return nullptr;
  unsigned int* clone = new unsigned int[static_cast<unsigned>(total)];
  std::fill(std::copy_n(words, used, clone), clone + total, 0U);
  return clone;
}

}  // namespace

static_assert(sizeof(GSBitSet) == 16 && sizeof(unsigned int) * CHAR_BIT == kWordBits, "fixed layout");

GSBitSet::GSBitSet() : _nalloc(0), _data(nullptr) {}

GSBitSet::GSBitSet(unsigned int nbits, int value) : GSBitSet() {
  if (nbits == 0) return;
  prepare(static_cast<int>((nbits - 1) / kWordBits + 1));
  fillall(value);
}

GSBitSet::GSBitSet(const GSBitSet& other)
    : _nalloc(other._nalloc), _data(cloneWords(other._data, other._nalloc, other._nalloc)) {}

GSBitSet& GSBitSet::operator=(const GSBitSet& other) {
  CopyFrom(other);
  return *this;
}

GSBitSet::~GSBitSet() { delete[] _data; }

int GSBitSet::size() const { return static_cast<int>(std::min<int64_t>(int64_t{_nalloc} * kWordBits, INT_MAX)); }

int GSBitSet::get(int i) const {
  if (i < 0 || i / kWordBits >= _nalloc) return 0;
  return (_data[i / kWordBits] & bitOf(i)) != 0 ? 1 : 0;
}

void GSBitSet::set(int i, int value) {
  if (i < 0) return;
  prepare(i / kWordBits + 1);
  unsigned int& word = _data[i / kWordBits];
  word = value != 0 ? word | bitOf(i) : word & ~bitOf(i);
}

void GSBitSet::fillall(int value) { std::fill_n(_data, _nalloc, value != 0 ? ~0U : 0U); }

void GSBitSet::eraseall() {
  delete[] _data;
  _data = nullptr;
  _nalloc = 0;
}

void GSBitSet::CopyFrom(const GSBitSet& other) {
  if (this == &other) return;
  unsigned int* words = cloneWords(other._data, other._nalloc, other._nalloc);
  delete[] _data;
  _data = words;
  _nalloc = other._nalloc;
}

int GSBitSet::AreAllZero() const {
  return std::all_of(_data, _data + _nalloc, [](unsigned int word) { return word == 0; }) ? 1 : 0;
}

int GSBitSet::AreTheySame(const GSBitSet& other) const {
  if (_nalloc < other._nalloc) return other.AreTheySame(*this);
  if (!std::equal(other._data, other._data + other._nalloc, _data)) return 0;
  return std::all_of(_data + other._nalloc, _data + _nalloc, [](unsigned int word) { return word == 0; }) ? 1 : 0;
}

int GSBitSet::lowerbound() const {
  for (int w = 0; w < _nalloc; ++w) {
    if (_data[w] != 0) return w * kWordBits + std::countr_zero(_data[w]);
  }
  return -1;
}

int GSBitSet::upperbound() const {
  for (int w = _nalloc - 1; w >= 0; --w) {
    if (_data[w] != 0) return w * kWordBits + kWordBits - 1 - std::countl_zero(_data[w]);
  }
  return -1;
}

void GSBitSet::prepare(int nwords) {
  if (nwords <= _nalloc) return;
  unsigned int* words = cloneWords(_data, _nalloc, nwords);
  delete[] _data;
  _data = words;
  _nalloc = nwords;
}

}  // namespace zelt_gscl_V1
