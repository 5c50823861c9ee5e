#include "gscl/GSLocalVar.h"

#include <cstring>

namespace zelt_gscl_V1 {

GSLocalVar<char>::GSLocalVar(unsigned int n) : _data(nullptr), _size(0) { allocate(n); }

GSLocalVar<char>::~GSLocalVar() { deallocate(); }

void GSLocalVar<char>::allocate(unsigned int n) {
  deallocate();
  if (n == 0) return;
  _data = new char[n];
  _size = n;
}

void GSLocalVar<char>::deallocate() {
  delete[] _data;
  _data = nullptr;
  _size = 0;
}

void GSLocalVar<char>::erase() {
  if (_data != nullptr) std::memset(_data, 0, _size);
}

unsigned int GSLocalVar<char>::size() const { return _size; }

char* GSLocalVar<char>::data() { return _data; }

const char* GSLocalVar<char>::data() const { return _data; }

GSLocalVar<char>::operator char*() { return _data; }

bool GSLocalVar<char>::operator!() const { return _data == nullptr; }

char& GSLocalVar<char>::operator[](ptrdiff_t i) { return _data[i]; }

const char& GSLocalVar<char>::operator[](ptrdiff_t i) const { return _data[i]; }

}  // namespace zelt_gscl_V1
