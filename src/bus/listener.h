// A listener: a (channel, id) pair registered on a bus, and the sorted list a
// bus keeps per process. Pure code, free of Win32, so the codec that uses it
// can be built natively.
#pragma once

#include <cstddef>
#include <functional>
#include <list>
#include <set>
#include <string>
#include <utility>

struct listener {
  std::string channel;
  std::string id;
};

// -1, 0 or 1 as `a` orders before, with or after `b`, compared as unsigned
// bytes, the shorter string first on a common prefix: std::string's order.
// Written out because the C runtime's memcmp behind std::string::compare
// costs several times as much under Wine, and a table of N listeners makes
// log N comparisons per registration.
inline int compare_bytes(const std::string& a, const std::string& b) {
  const std::size_t common = a.size() < b.size() ? a.size() : b.size();
  const auto* p = reinterpret_cast<const unsigned char*>(a.data());
  const auto* q = reinterpret_cast<const unsigned char*>(b.data());
  for (std::size_t i = 0; i < common; ++i) {
    if (p[i] != q[i]) return p[i] < q[i] ? -1 : 1;
  }
  return a.size() < b.size() ? -1 : a.size() > b.size() ? 1 : 0;
}

// By channel, then by id, each compared as bytes (the shorter string is less
// on a common prefix).
inline bool operator<(const listener& a, const listener& b) {
  const int channel = compare_bytes(a.channel, b.channel);
  return channel != 0 ? channel < 0 : compare_bytes(a.id, b.id) < 0;
}
inline bool operator==(const listener& a, const listener& b) {
  return a.channel == b.channel && a.id == b.id;
}
inline bool operator!=(const listener& a, const listener& b) { return !(a == b); }

// Kept in ascending order; equal listeners may occur several times and stay
// adjacent.
using listener_list = std::list<listener>;
// The same order with a logarithmic insert and find, for a table that
// changes one listener at a time; equal listeners are kept side by side.
using listener_set = std::multiset<listener>;

// For tables kept by hash: both strings count.
struct listener_hash {
  std::size_t operator()(const listener& item) const noexcept {
    const std::hash<std::string> text;
    return text(item.channel) * 31 + text(item.id);
  }
};

// Inserts before the first element that is not less than `item`.
inline void insert_sorted(listener_list& list, listener item) {
  auto at = list.begin();
  while (at != list.end() && *at < item) ++at;
  list.insert(at, std::move(item));
}
