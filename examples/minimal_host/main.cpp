// A minimal host of vorbel.dll. It loads the component from its own folder,
// creates one bus with a local channel, registers a listener and hears of it
// through a bus observer, unregisters it and hears that too, then tears
// everything down in the reverse order. Each step prints one line; the exit
// code is 0 only when every step happened.
//
// The bus offers nothing to other processes (no exported or imported
// channels), so this program needs no code signature.
#include <vorbel/host.h>
#include <vorbel/vorbel.h>

#include <windows.h>

#include <chrono>
#include <condition_variable>
#include <cstdint>
#include <cstdio>
#include <cstring>
#include <mutex>
#include <string>

namespace {

const char* const bus_name = "minimal";
const char* const channel_name = "alerts";
const char* const listener_id = "minimal-host-1";
// Notifications arrive on the bus's own thread, normally within
// milliseconds; a missing one must not hang the program.
const std::chrono::seconds notification_wait(5);

void say(const char* line) {
  std::printf("%s\n", line);
  std::fflush(stdout);
}

void fail(const char* what, std::uint32_t err = 0) {
  if (err != 0) {
    std::fprintf(stderr, "minimal_host: %s (err=%u)\n", what, static_cast<unsigned>(err));
  } else {
    std::fprintf(stderr, "minimal_host: %s\n", what);
  }
  std::fflush(stderr);
}

// The folder of this program, where vorbel.dll and its siblings are.
// Returns 0 or a Win32 error code.
std::uint32_t program_folder(std::wstring& folder) {
  std::wstring path(MAX_PATH, L'\0');
  for (;;) {
    const DWORD length = ::GetModuleFileNameW(nullptr, &path[0], static_cast<DWORD>(path.size()));
    if (length == 0) {
      const DWORD err = ::GetLastError();
      return err != 0 ? err : ERROR_GEN_FAILURE;
    }
    if (length < path.size()) {
      path.resize(length);
      break;
    }
    // A full buffer means the path was cut: try again with more room.
    if (path.size() >= 32768) return ERROR_FILENAME_EXCED_RANGE;
    path.resize(path.size() * 2);
  }
  const std::wstring::size_type slash = path.find_last_of(L"\\/");
  if (slash == std::wstring::npos) return ERROR_BAD_PATHNAME;
  folder = path.substr(0, slash);
  return 0;
}

// One bus, one local channel, no gateway. The component calls it only during
// create_bus, on the calling thread.
class local_configuration : public ibus_configuration {
 public:
  void* GetInterface(GUID iid) override {
    return qm::same_iid(iid, IID_IQmBaseInterface) ? static_cast<IQmBaseInterface*>(this) : nullptr;
  }
  bool is_default_bus() override { return true; }
  bool next_local_channel(std::uint64_t* cursor, const char** channel) override {
    if (cursor == nullptr || channel == nullptr || *cursor != 0) return false;
    *channel = channel_name;
    *cursor = 1;
    return true;
  }
  bool next_exported_channel(std::uint64_t*, const char**, const char**, std::uint32_t*,
                             std::uint32_t*) override {
    return false;
  }
  bool next_imported_channel(std::uint64_t*, const char**, const char**, std::uint32_t*,
                             std::uint32_t*, const char**, const char**) override {
    return false;
  }
};

// Counts the notifications about this program's own listener. The bus calls
// it on its notification thread; main waits on it.
class listener_observer : public ibus_observer {
 public:
  void* GetInterface(GUID iid) override {
    if (qm::same_iid(iid, IID_ibus_observer)) return static_cast<ibus_observer*>(this);
    if (qm::same_iid(iid, IID_IQmBaseInterface)) return static_cast<IQmBaseInterface*>(this);
    return nullptr;
  }
  void on_new_listener(std::uint32_t pid, const char* channel, const char* id) override {
    record(pid, channel, id, added_);
  }
  void on_listener_removed(std::uint32_t pid, const char* channel, const char* id) override {
    record(pid, channel, id, removed_);
  }

  // True when the new-listener (or removed-listener) notification came in
  // time.
  bool wait_added() { return wait_for(added_); }
  bool wait_removed() { return wait_for(removed_); }

 private:
  void record(std::uint32_t pid, const char* channel, const char* id, int& counter) {
    if (pid != ::GetCurrentProcessId() || channel == nullptr || id == nullptr) return;
    if (std::strcmp(channel, channel_name) != 0 || std::strcmp(id, listener_id) != 0) return;
    {
      std::lock_guard<std::mutex> lock(mutex_);
      ++counter;
    }
    changed_.notify_all();
  }

  bool wait_for(const int& counter) {
    std::unique_lock<std::mutex> lock(mutex_);
    return changed_.wait_for(lock, notification_wait, [&] { return counter > 0; });
  }

  std::mutex mutex_;
  std::condition_variable changed_;
  int added_ = 0;
  int removed_ = 0;
};

// Register, hear, unregister, hear. The observer is added and removed by the
// caller.
bool exercise(ibus* bus, listener_observer& observer) {
  if (std::uint32_t err = bus->register_listener(channel_name, listener_id)) {
    fail("register_listener failed", err);
    return false;
  }
  say("registered listener alerts/minimal-host-1");
  if (!observer.wait_added()) {
    fail("no new-listener notification within 5 s");
    return false;
  }
  say("heard: new listener alerts/minimal-host-1 in this process");
  if (!bus->is_registered_listener(channel_name, listener_id)) {
    fail("the bus does not know the registered listener");
    return false;
  }
  say("the bus knows the listener");

  if (std::uint32_t err = bus->unregister_listener(channel_name, listener_id)) {
    fail("unregister_listener failed", err);
    return false;
  }
  say("unregistered listener alerts/minimal-host-1");
  if (!observer.wait_removed()) {
    fail("no listener-removed notification within 5 s");
    return false;
  }
  say("heard: listener removed alerts/minimal-host-1 in this process");
  if (bus->is_registered_listener(channel_name, listener_id)) {
    fail("the bus still knows the unregistered listener");
    return false;
  }
  say("the bus no longer knows the listener");
  return true;
}

}  // namespace

int main() {
  std::wstring folder;
  if (std::uint32_t err = program_folder(folder)) {
    fail("cannot find the program's folder", err);
    return 1;
  }

  vorbel::host_library library;
  if (std::uint32_t err = library.open(folder)) {
    fail("cannot load vorbel.dll from the program's folder", err);
    return 1;
  }
  say("loaded vorbel.dll and created the registry");

  local_configuration configuration;
  ibus* bus = library.registry()->create_bus(bus_name, &configuration);
  if (bus == nullptr) {
    fail("create_bus failed");
    return 1;  // the library's destructor gives the registry back
  }
  say("created bus \"minimal\" with channel \"alerts\"");

  listener_observer observer;
  bool ok = bus->add_observer(&observer, 0);
  if (ok) {
    say("observer added");
    ok = exercise(bus, observer);
    // Once remove_observer returns, no notification is running in the
    // observer, so it may go.
    if (bus->remove_observer(&observer, 0)) {
      say("observer removed");
    } else {
      fail("remove_observer found no observer");
      ok = false;
    }
  } else {
    fail("add_observer failed");
  }

  library.registry()->destroy_bus(bus_name);
  say("bus destroyed");
  library.close();
  say("registry given back and vorbel.dll unloaded");
  say(ok ? "done" : "failed");
  return ok ? 0 : 1;
}
