// The exports of parlo_ipc.dll: create_gateway and destroy_gateway
// (src/gateway/parlo_ipc/parlo_ipc.h). Each gateway holds a reference on the
// process's logging binding for its life, so its threads' lines reach
// scribo.dll.
#include <windows.h>

#include <algorithm>
#include <mutex>
#include <new>
#include <type_traits>
#include <vector>

#include "gateway/parlo_ipc/parlo_ipc.h"
#include "gateway_impl.h"
#include "logging/log_dll.h"
#include "logging/logger.h"
#include "platform/srw_sync.h"

using parlo::ipc::impl::gateway_impl;

namespace {

// The gateways create_gateway made and destroy_gateway has not freed; an
// unknown pointer handed to destroy_gateway is refused, not deleted.
struct live_gateways {
  srw_mutex mutex;
  std::vector<parlo::ipc::gateway*> list;
};

live_gateways& live() {
  static live_gateways instance;
  return instance;
}

}  // namespace

extern "C" {

parlo::ipc::gateway* create_gateway(parlo::bus* bus, parlo::ipc::gateway::events* sink) {
  logging::add_reference();
  if (bus == nullptr || sink == nullptr) {
    logging::logger_stream(logging::level_error, L"parlo_ipc::create_gateway")
        << L"bus or sink is nullptr";
    logging::release_reference();
    ::SetLastError(ERROR_INVALID_PARAMETER);
    return nullptr;
  }
  gateway_impl* created = nullptr;
  std::uint32_t err = 0;
  try {
    created = new gateway_impl(bus, sink);
    err = created->init();
    if (err == 0) {
      live_gateways& gateways = live();
      std::lock_guard<srw_mutex> lock(gateways.mutex);
      gateways.list.push_back(created);
    }
  } catch (const std::bad_alloc&) {
    err = ERROR_NOT_ENOUGH_MEMORY;
  } catch (const std::exception& e) {
    logging::logger_stream(logging::level_error, L"parlo_ipc::create_gateway") << e.what();
    err = ERROR_GEN_FAILURE;
  }
  if (err != 0) {
    logging::logger_stream(logging::level_error, L"parlo_ipc::create_gateway")
        << L"create_gateway failed err=" << err;
    delete created;
    logging::release_reference();
    ::SetLastError(err);
    return nullptr;
  }
  return created;
}

void destroy_gateway(parlo::ipc::gateway* gateway) {
  // Lines of a refused call need a binding of their own: no gateway may hold
  // one.
  logging::logger_ref ref;
  ref.acquire();
  if (gateway == nullptr) {
    logging::logger_stream(logging::level_error, L"parlo_ipc::destroy_gateway")
        << L"gateway is nullptr";
    return;
  }
  gateway_impl* found = nullptr;
  {
    live_gateways& gateways = live();
    std::lock_guard<srw_mutex> lock(gateways.mutex);
    const auto it = std::find(gateways.list.begin(), gateways.list.end(), gateway);
    if (it != gateways.list.end()) {
      found = static_cast<gateway_impl*>(*it);
      // Destroying from inside one of its own events would join the very
      // thread that asks: refused, the gateway stays.
      if (found->on_own_thread()) {
        found = nullptr;
      } else {
        gateways.list.erase(it);
      }
    }
  }
  if (found == nullptr) {
    logging::logger_stream(logging::level_error, L"parlo_ipc::destroy_gateway")
        << L"not a live gateway of this library, or called from one of its events: ignored";
    return;
  }
  // The destructor stops the gateway: no event follows its return.
  delete found;
  logging::release_reference();
}

}  // extern "C"

// The exports must keep the types the interface gives its callers.
static_assert(std::is_same_v<decltype(&create_gateway), parlo::ipc::create_gateway_fn>);
static_assert(std::is_same_v<decltype(&destroy_gateway), parlo::ipc::destroy_gateway_fn>);
