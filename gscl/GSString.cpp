#include "gscl/GSString.h"

#include <climits>
#include <cstdio>
#include <cstring>
#include <new>

#include "gscl/GSLocalVar.h"

namespace zelt_gscl_V1 {
namespace {

/// Bytes for texts of these lengths in one, with the terminator. Sizes are int.
int bytes_for(size_t length, size_t more = 0) {
  const size_t need = length + more + 1;
  if (need > static_cast<size_t>(INT_MAX)) throw std::bad_alloc();
  return static_cast<int>(need);
}

}  // namespace

GSString::GSString() : _area(nullptr), _size(0) {}

GSString::GSString(int n) : GSString() {
  if (n < 1) return;
  allocate(n);
  std::memset(_area, 0, static_cast<size_t>(n));
}

GSString::GSString(const char* s) : GSString() { set_string(s, 0); }

GSString::GSString(const GSString& o) : GSString() { set_string(o._area, 0); }

GSString::~GSString() { deallocate(); }

GSString& GSString::operator=(const char* s) {
  set_string(s, 0);
  return *this;
}

GSString& GSString::operator=(const GSString& o) {
  set_string(o._area, 0);
  return *this;
}

GSString& GSString::operator+=(const char* s) {
  if (s == nullptr) return *this;
  if (_area == nullptr) {
    set_string(s, 0);
    return *this;
  }
  const size_t old_length = std::strlen(_area);
  const size_t added = std::strlen(s);
  const int need = bytes_for(old_length, added);
  if (_size >= need) {
    // s may lie in this very text, whose terminator is overwritten here: no string function may look for it.
    std::memmove(_area + old_length, s, added);
    _area[old_length + added] = '\0';
    return *this;
  }
  GSLocalVar<char> joined(static_cast<unsigned int>(need));
  std::memcpy(joined, _area, old_length);
  std::memcpy(joined + old_length, s, added + 1);
  set_string(joined, 0);
  return *this;
}

GSString& GSString::operator+=(const GSString& o) { return *this += static_cast<const char*>(o); }

void GSString::set_string(const char* s, int len) {
  if (s == nullptr) {
    deallocate();
    return;
  }
  size_t length = std::strlen(s);
  const int need = bytes_for(length);
  // A text inside this object's own storage always fits, so s is never freed here before it is copied.
  if (_size < need) allocate(need);
  if (len >= 1 && length > static_cast<size_t>(len)) length = static_cast<size_t>(len);
  std::memmove(_area, s, length);
  _area[length] = '\0';
}

GSString::operator char*() { return _area; }

GSString::operator const char*() const { return _area; }

int GSString::size() const { return _size; }

int GSString::length() const { return _area == nullptr ? 0 : static_cast<int>(std::strlen(_area)); }

void GSString::allocate(int n) {
  delete[] _area;
  _area = nullptr;
  _size = 0;
  if (n == 0) return;
  _area = new char[static_cast<size_t>(n)];
  _size = n;
}

void GSString::deallocate() { allocate(0); }

GSString operator+(const GSString& a, const char* s) {
  if (s == nullptr) return a;
  const size_t first = static_cast<size_t>(a.length());
  const size_t second = std::strlen(s);
  GSString joined(bytes_for(first, second));
  char* text = joined;
  if (first > 0) std::memcpy(text, static_cast<const char*>(a), first);
  std::memcpy(text + first, s, second);
  return joined;
}

bool operator==(const GSString& a, const char* s) {
  const char* text = a;
  if (text == nullptr || s == nullptr) return text == s;
  return std::strcmp(text, s) == 0;
}

}  // namespace zelt_gscl_V1
