// Root interface and interface identifiers shared by every vorbel object.
//
// An interface identifier is a 16-byte GUID passed by value. Identifiers are
// compared as two unsigned 64-bit halves: the first eight bytes in memory
// order (Data1, Data2, Data3, little-endian) and the last eight (Data4).
#pragma once

#include <guiddef.h>

#include <cstdint>
#include <cstring>

// Interfaces are abstract classes whose first slot is GetInterface. They have
// no virtual destructors: an object's owner destroys its concrete class.
struct IQmBaseInterface {
  // Returns this object's face for `iid`, or null when it has none.
  virtual void* GetInterface(GUID iid) = 0;
};

namespace qm {

struct iid_halves {
  std::uint64_t first;
  std::uint64_t last;
};

inline iid_halves split_iid(const GUID& iid) {
  iid_halves h;
  std::memcpy(&h.first, &iid, sizeof h.first);
  std::memcpy(&h.last, reinterpret_cast<const unsigned char*>(&iid) + 8, sizeof h.last);
  return h;
}

inline bool same_iid(const GUID& a, const GUID& b) {
  const iid_halves x = split_iid(a);
  const iid_halves y = split_iid(b);
  return x.first == y.first && x.last == y.last;
}

}  // namespace qm

// {66551AB3-FCA3-BC90-5F42-C5F792E24B51}: answered by every vorbel object.
inline constexpr GUID IID_IQmBaseInterface = {
    0x66551AB3, 0xFCA3, 0xBC90, {0x5F, 0x42, 0xC5, 0xF7, 0x92, 0xE2, 0x4B, 0x51}};

// {414E2323-04D0-9833-7641-887C5D8252E9}: accepted by QmCreateObject, answered
// by no object (a creation with it yields 14 but still counts a use).
inline constexpr GUID IID_IQmCreateAlternate = {
    0x414E2323, 0x04D0, 0x9833, {0x76, 0x41, 0x88, 0x7C, 0x5D, 0x82, 0x52, 0xE9}};
