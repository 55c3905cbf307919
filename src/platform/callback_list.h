// A thread-safe list of observers, walked to notify them.
//
// Owned by the observable object (bus or gateway), which keeps it alive as
// long as anybody may use it. Any thread may add, remove and walk. Walks hold
// the list's read lock, so several run at once and a nested walk on the same
// thread proceeds even while a writer waits; add and remove hold the write
// lock and wait for every walk in progress. Lock order: the list's lock, then
// an entry's lock.
#pragma once

#include <cstdint>
#include <exception>
#include <memory>
#include <type_traits>
#include <utility>
#include <vector>

#include "logging/logger.h"
#include "platform/sync_rw_lock.h"

template <typename T>
class CallbackList {
 public:
  struct callback_entry {
    callback_entry(T entry_observer, std::uintptr_t entry_context)
        : observer(entry_observer), context(entry_context) {}

    T observer;
    // Stored and matched on removal, never passed to the observer.
    std::uintptr_t context;
    CSyncRWLock lock;
    bool active = true;
  };

  // Result of remove when no entry matched (ERROR_NOT_FOUND).
  static constexpr std::uint32_t not_found = 1168;

  CallbackList() = default;
  CallbackList(const CallbackList&) = delete;
  CallbackList& operator=(const CallbackList&) = delete;
  // Takes no lock: the owner makes sure nobody uses the list any more.
  ~CallbackList() { entries_.clear(); }

  // False when the observer is already listed (whatever its context), when it
  // is null, or when it cannot be added: from inside a walk of this list on
  // this thread (that would deadlock) or for lack of resources.
  bool add(T observer, std::uintptr_t context) {
    if (!admissible(observer, L"CallbackList::add")) return false;
    try {
      auto entry = std::make_unique<callback_entry>(observer, context);
      bool found = false;
      rw_write_guard guard(lock_);
      for (const auto& existing : entries_) {
        rw_read_guard entry_guard(existing->lock);
        if (existing->active && existing->observer == observer) {
          found = true;
          break;
        }
      }
      if (!found) entries_.push_back(std::move(entry));
      return !found;
    } catch (const std::exception& e) {
      logging::logger_stream(logging::level_error, L"CallbackList::add")
          << "cannot add an observer: " << e.what();
      return false;
    }
  }

  // 0 when the first active entry with this observer and this context was
  // removed (the others keep their order), 1168 otherwise.
  virtual std::uint32_t remove(T observer, std::uintptr_t context) {
    if (!admissible(observer, L"CallbackList::remove")) return not_found;
    std::unique_ptr<callback_entry> removed;  // destroyed after the lock is left
    {
      rw_write_guard guard(lock_);
      for (auto it = entries_.begin(); it != entries_.end(); ++it) {
        if ((*it)->active && (*it)->observer == observer && (*it)->context == context) {
          removed = std::move(*it);
          entries_.erase(it);
          break;
        }
      }
    }
    return removed ? 0 : not_found;
  }

  // Calls notify(observer) for every active entry, in the order of addition,
  // under the list's read lock and the entry's. If notify throws, both locks
  // are released before the exception leaves.
  template <typename F>
  void walk(F&& notify) {
    rw_read_guard guard(lock_);
    for (const auto& entry : entries_) {
      rw_read_guard entry_guard(entry->lock);
      if (!entry->active) continue;
      notify(entry->observer);
    }
  }

 private:
  bool admissible(T observer, const wchar_t* function) {
    if constexpr (std::is_pointer_v<T>) {
      if (observer == nullptr) {
        logging::logger_stream(logging::level_error, function) << "null observer refused";
        return false;
      }
    }
    // Asking for the write lock while this thread walks the list would end
    // the process; an observer that reacts to a notification this way gets a
    // refusal instead.
    if (lock_.IsReading(0)) {
      logging::logger_stream(logging::level_error, function)
          << "refused from inside a notification of the same list";
      return false;
    }
    return true;
  }

  std::vector<std::unique_ptr<callback_entry>> entries_;
  CSyncRWLock lock_;
};
