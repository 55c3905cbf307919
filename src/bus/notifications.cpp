#include "bus/notifications.h"

#include <exception>
#include <memory>
#include <utility>

#include "logging/logger.h"

namespace {

using notify_fn = void (*)(bus_observer_list*, std::uint32_t, const char*, const char*);

void notify(const wchar_t* function, bus_observer_list* list, std::uint32_t pid,
            const char* channel, const char* id, bool added) {
  logging::logger_stream(logging::level_info, function)
      << function << L" pid=" << pid << L" channel=" << channel << L" id=" << id;
  try {
    list->walk([&](ibus_observer_base* entry) {
      auto* observer = static_cast<ibus_observer*>(entry->GetInterface(IID_ibus_observer));
      if (observer == nullptr) return;
      if (added) {
        observer->on_new_listener(pid, channel, id);
      } else {
        observer->on_listener_removed(pid, channel, id);
      }
    });
  } catch (const std::exception& e) {
    // An observer's exception must not end the notifier thread, and with it
    // the host process.
    logging::logger_stream(logging::level_error, function) << L"observer threw: " << e.what();
  } catch (...) {
    logging::logger_stream(logging::level_error, function) << L"observer threw";
  }
}

void post_one(task_pool<0>& pool, bus_observer_list* list, std::uint32_t pid, const listener& item,
              notify_fn fn) {
  pool.post([list, pid, item, fn] { fn(list, pid, item.channel.c_str(), item.id.c_str()); });
}

void post_many(task_pool<0>& pool, bus_observer_list* list, std::uint32_t pid,
               listener_list items, notify_fn fn) {
  // std::function needs a copyable callable: the list travels behind a
  // shared pointer instead of being copied.
  auto shared = std::make_shared<listener_list>(std::move(items));
  // A list of thousands would hold up the teardown of its bus: the task
  // gives up once the pool is stopping, as the tasks behind it are dropped.
  pool.post([&pool, list, pid, shared, fn] {
    for (const listener& item : *shared) {
      if (pool.stopping()) return;
      fn(list, pid, item.channel.c_str(), item.id.c_str());
    }
  });
}

}  // namespace

void notify_new_listener(bus_observer_list* list, std::uint32_t pid, const char* channel,
                         const char* id) {
  notify(L"notify_new_listener", list, pid, channel, id, /* added */ true);
}

void notify_listener_removed(bus_observer_list* list, std::uint32_t pid, const char* channel,
                             const char* id) {
  notify(L"notify_listener_removed", list, pid, channel, id, /* added */ false);
}

void post_new_listener(task_pool<0>& pool, bus_observer_list* list, std::uint32_t pid,
                       const listener& item) {
  post_one(pool, list, pid, item, &notify_new_listener);
}

void post_listener_removed(task_pool<0>& pool, bus_observer_list* list, std::uint32_t pid,
                           const listener& item) {
  post_one(pool, list, pid, item, &notify_listener_removed);
}

void post_new_listeners(task_pool<0>& pool, bus_observer_list* list, std::uint32_t pid,
                        listener_list items) {
  if (items.empty()) return;
  post_many(pool, list, pid, std::move(items), &notify_new_listener);
}

void post_listeners_removed(task_pool<0>& pool, bus_observer_list* list, std::uint32_t pid,
                            listener_list items) {
  if (items.empty()) return;
  post_many(pool, list, pid, std::move(items), &notify_listener_removed);
}
