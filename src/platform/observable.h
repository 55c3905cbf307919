// The add_observer and remove_observer faces of the bus and the gateway.
//
// The observable object owns its observer list; host threads add and remove
// observers, and the owner's notification tasks walk observer_list().
#pragma once

#include <vorbel/iobservable.h>

#include <cstdint>

#include "platform/callback_list.h"

namespace qm {

// Interface derives from iobservable<T> (ibus, igateway).
template <typename T, typename Interface>
class observable : public Interface {
 public:
  bool add_observer(T observer, std::uintptr_t context) override {
    return observers_.add(observer, context);
  }
  bool remove_observer(T observer, std::uintptr_t context) override {
    return observers_.remove(observer, context) == 0;
  }

  CallbackList<T>& observer_list() { return observers_; }

 private:
  CallbackList<T> observers_;
};

}  // namespace qm
