// Tasks the gateway observer posts to its task pool for each pipe event: the
// connections-cache changes and the notifications of the gateway's
// observers. They run on the pool's single worker, in posting order, which
// is what keeps the cache consistent with the notifications: a connection is
// inserted before its connect notification and removed after its disconnect
// notification.
#pragma once

#include <vorbel/igateway.h>

#include <windows.h>

#include <cstdint>
#include <functional>
#include <string>

#include "gateway/admission.h"
#include "gateway/connections_cache.h"
#include "platform/callback_list.h"

using gateway_observer_list = CallbackList<igateway_observer_base*>;

enum class gateway_event {
  local_connect,
  local_disconnect,
  local_start_communication,
  local_error,
  remote_connect,
  remote_disconnect,
  remote_start_communication,
  remote_error,
};

// Caches (handle, name, pid). The name is read from the handle when the
// connect event arrives (get_pipe_name): by the time the task runs, the IPC
// library may have closed the handle and the system given its value to
// another pipe.
std::function<void()> make_connection_insert(connections_cache* cache, HANDLE pipe,
                                             std::string name, std::uint32_t pid);
std::function<void()> make_connection_removal(connections_cache* cache, HANDLE pipe);

// Calls on_listen(name) on every observer.
std::function<void()> make_listen_notification(gateway_observer_list* observers, std::string name);

// Looks the pipe up in the cache and calls the event's operation on every
// observer. The connect events pass the event's own `pid`; the others the
// cached one. `err` is used by the error events only.
std::function<void()> make_event_notification(gateway_event event,
                                              gateway_observer_list* observers,
                                              connections_cache* cache, HANDLE pipe,
                                              std::uint32_t pid = 0, std::uint32_t err = 0);

// Calls on_admission with a copy of `facts` on every observer that offers
// igateway_admission_observer; the others are passed over.
std::function<void()> make_admission_notification(gateway_observer_list* observers, const admission_facts& facts);
