// Listener notifications of a bus: the tasks the bus posts to its notifier
// thread, and the walks over its observer list that they run.
#pragma once

#include <vorbel/ibus.h>

#include <cstdint>

#include "bus/listener.h"
#include "platform/callback_list.h"
#include "platform/task_pool.h"

using bus_observer_list = CallbackList<ibus_observer_base*>;

// Run only on the bus's notifier thread. Each writes its line, then calls
// every active observer that answers IID_ibus_observer.
void notify_new_listener(bus_observer_list* list, std::uint32_t pid, const char* channel,
                         const char* id);
void notify_listener_removed(bus_observer_list* list, std::uint32_t pid, const char* channel,
                             const char* id);

// Posting: the observer list is read when the task runs, not when it is
// posted. The tasks hold copies; they never touch the bus itself.
void post_new_listener(task_pool<0>& pool, bus_observer_list* list, std::uint32_t pid,
                       const listener& item);
void post_listener_removed(task_pool<0>& pool, bus_observer_list* list, std::uint32_t pid,
                           const listener& item);
void post_new_listeners(task_pool<0>& pool, bus_observer_list* list, std::uint32_t pid,
                        listener_list items);
void post_listeners_removed(task_pool<0>& pool, bus_observer_list* list, std::uint32_t pid,
                            listener_list items);
