// A listener: a (channel, id) pair registered on a bus, and the sorted list a
// bus keeps per process. Pure code, free of Win32, so the codec that uses it
// can be built natively.
#pragma once

#include <list>
#include <string>
#include <tuple>
#include <utility>

struct listener {
  std::string channel;
  std::string id;
};

// By channel, then by id, each compared as bytes (the shorter string is less
// on a common prefix).
inline bool operator<(const listener& a, const listener& b) {
  return std::tie(a.channel, a.id) < std::tie(b.channel, b.id);
}
inline bool operator==(const listener& a, const listener& b) {
  return a.channel == b.channel && a.id == b.id;
}
inline bool operator!=(const listener& a, const listener& b) { return !(a == b); }

// Kept in ascending order; equal listeners may occur several times and stay
// adjacent.
using listener_list = std::list<listener>;

// Inserts before the first element that is not less than `item`.
inline void insert_sorted(listener_list& list, listener item) {
  auto at = list.begin();
  while (at != list.end() && *at < item) ++at;
  list.insert(at, std::move(item));
}
