#pragma once

// Fixed-size values to and from byte strings, in host byte order: for the sketch and book
// encodings, which are read back only on the host that wrote them.

#include <cstring>
#include <string>
#include <string_view>
#include <type_traits>

namespace bytecodec {

template <class T>
void Put(std::string* out, const T& value) {
  static_assert(std::is_trivially_copyable_v<T>);
  out->append(reinterpret_cast<const char*>(&value), sizeof(value));
}

// Takes a T from the front of *in; false, with nothing taken, when fewer bytes remain.
template <class T>
bool Take(std::string_view* in, T* value) {
  static_assert(std::is_trivially_copyable_v<T>);
  if (in->size() < sizeof(T)) {
    return false;
  }
  std::memcpy(value, in->data(), sizeof(T));
  in->remove_prefix(sizeof(T));
  return true;
}

}  // namespace bytecodec
