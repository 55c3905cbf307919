#include "gateway/notify_tasks.h"

#include <exception>
#include <memory>

#include "logging/logger.h"

using logging::level_error;
using logging::level_info;
using logging::logger_stream;

namespace {

struct event_traits {
  const wchar_t* function;  // the handler's name, its callable type, operator ()
  const wchar_t* name;      // the event as written in the line
  bool event_pid;           // the connect events carry their own pid
  bool has_err;
};

const event_traits& traits_of(gateway_event event) {
  static const event_traits table[] = {
      {L"notify_on_local_connect_handler::task::operator ()", L"on_local_connect", true, false},
      {L"notify_on_local_disconnect_handler::task::operator ()", L"on_local_disconnect", false, false},
      {L"notify_on_local_start_communication_handler::task::operator ()",
       L"on_local_start_communication", false, false},
      {L"notify_on_local_error_handler::task::operator ()", L"on_local_error", false, true},
      {L"notify_on_remote_connect_handler::task::operator ()", L"on_remote_connect", true, false},
      {L"notify_on_remote_disconnect_handler::task::operator ()", L"on_remote_disconnect", false, false},
      {L"notify_on_remote_start_communication_handler::task::operator ()",
       L"on_remote_start_communication", false, false},
      {L"notify_on_remote_error_handler::task::operator ()", L"on_remote_error", false, true},
  };
  return table[static_cast<int>(event)];
}

// Calls `call` with each active observer that gives the face `Face` for
// `iid` (igateway_observer unless said otherwise). An observer's exception
// is logged and ends this walk only: it must not end the worker thread, and
// with it the host process.
template <typename Face = igateway_observer, typename Call>
void notify_observers(const wchar_t* function, gateway_observer_list* observers, Call&& call,
                      const GUID& iid = IID_igateway_observer) {
  try {
    observers->walk([&](igateway_observer_base* entry) {
      auto* observer = static_cast<Face*>(entry->GetInterface(iid));
      if (observer != nullptr) call(observer);
    });
  } catch (const std::exception& e) {
    logger_stream(level_error, function) << L"observer threw: " << e.what();
  } catch (...) {
    logger_stream(level_error, function) << L"observer threw";
  }
}

void call_event(igateway_observer* o, gateway_event event, const char* name, std::uint32_t pid,
                std::uint32_t err) {
  switch (event) {
    case gateway_event::local_connect: o->on_local_connect(name, pid); break;
    case gateway_event::local_disconnect: o->on_local_disconnect(name, pid); break;
    case gateway_event::local_start_communication: o->on_local_start_communication(name, pid); break;
    case gateway_event::local_error: o->on_local_error(name, pid, err); break;
    case gateway_event::remote_connect: o->on_remote_connect(name, pid); break;
    case gateway_event::remote_disconnect: o->on_remote_disconnect(name, pid); break;
    case gateway_event::remote_start_communication: o->on_remote_start_communication(name, pid); break;
    case gateway_event::remote_error: o->on_remote_error(name, pid, err); break;
  }
}

struct task {
  gateway_event event;
  gateway_observer_list* observers;
  connections_cache* cache;
  HANDLE pipe;
  std::uint32_t pid;
  std::uint32_t err;

  void operator()() const {
    const event_traits& traits = traits_of(event);
    // A view into the cache: nothing changes it while this task runs.
    const connection_info info = cache->get(pipe);
    const std::uint32_t shown_pid = traits.event_pid ? pid : info.pid;
    {
      logger_stream line(level_info, traits.function);
      line << L"notify " << traits.name << L" pipe=" << pipe << L" pipe_name=" << info.name
           << L" remote_pid=" << shown_pid;
      if (traits.has_err) line << L" err=" << err;
    }
    notify_observers(traits.function, observers, [&](igateway_observer* o) {
      call_event(o, event, info.name, shown_pid, err);
    });
  }
};

}  // namespace

std::function<void()> make_connection_insert(connections_cache* cache, HANDLE pipe,
                                             std::string name, std::uint32_t pid) {
  return [cache, pipe, name = std::move(name), pid] { cache->insert(pipe, name, pid); };
}

std::function<void()> make_connection_removal(connections_cache* cache, HANDLE pipe) {
  return [cache, pipe] { cache->rem(pipe); };
}

std::function<void()> make_listen_notification(gateway_observer_list* observers, std::string name) {
  return [observers, name = std::move(name)] {
    const wchar_t* function = L"notify_on_listen_handler::task::operator ()";
    logger_stream(level_info, function) << L"notify on_listen pipe_name=" << name;
    notify_observers(function, observers,
                     [&](igateway_observer* o) { o->on_listen(name.c_str()); });
  };
}

std::function<void()> make_event_notification(gateway_event event,
                                              gateway_observer_list* observers,
                                              connections_cache* cache, HANDLE pipe,
                                              std::uint32_t pid, std::uint32_t err) {
  return task{event, observers, cache, pipe, pid, err};
}

std::function<void()> make_admission_notification(gateway_observer_list* observers, const admission_facts& facts) {
  // Shared, not copied: the record's view points into its own strings.
  std::shared_ptr<const admission_record> record = std::make_shared<const admission_record>(facts);
  return [observers, record = std::move(record)] {
    notify_observers<igateway_admission_observer>(
        L"notify_on_admission_handler::task::operator ()", observers,
        [&](igateway_admission_observer* o) { o->on_admission(&record->view()); }, IID_igateway_admission_observer);
  };
}
