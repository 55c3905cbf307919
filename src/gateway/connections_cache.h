// Live pipe connections of one gateway: which pipe handle belongs to which
// pipe name and peer process.
//
// Owned by the gateway observer's notify context and touched only by tasks
// on that context's task pool, one at a time, so it has no lock. The handles
// are copies used as keys: the cache never closes them.
#pragma once

#include <windows.h>

#include <cstddef>
#include <cstdint>
#include <map>
#include <string>

// A view into the cache, valid until the cache next changes. A handle that is
// not cached gives an empty name and pid 0.
struct connection_info {
  const char* name;
  std::size_t length;
  std::uint32_t pid;
};

class connections_cache {
 public:
  // Keeps the first name and pid when the handle is already cached.
  void insert(HANDLE pipe, std::string name, std::uint32_t pid);
  // True when an entry was erased.
  bool rem(HANDLE pipe);
  connection_info get(HANDLE pipe) const;
  std::size_t size() const { return entries_.size(); }

 private:
  struct entry {
    std::string name;
    std::uint32_t pid;
  };
  static std::uint64_t key(HANDLE pipe) {
    return static_cast<std::uint64_t>(reinterpret_cast<std::uintptr_t>(pipe));
  }
  std::map<std::uint64_t, entry> entries_;
};

// The pipe's name as read from its handle, in UTF-8 (a backslash and the
// pipe's own name); empty when it cannot be read or converted.
std::string get_pipe_name(HANDLE pipe);
