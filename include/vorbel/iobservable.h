// Observer registration face shared by the bus and the gateway.
#pragma once

#include <cstdint>

namespace qm {

// T is the observer pointer type. The context travels with an entry and must
// match on removal; it is never passed to the observer.
template <typename T>
struct iobservable {
  // False when `observer` is already registered (whatever its context), or
  // when it cannot be added (null, from inside a notification of the same
  // list, or memory ran out).
  virtual bool add_observer(T observer, std::uintptr_t context) = 0;
  // True when an entry with this observer and this context was removed.
  virtual bool remove_observer(T observer, std::uintptr_t context) = 0;
};

}  // namespace qm
