// The peer role: `vorbel_bench peer`, started by a benchmark as process B.
//
// Commands, one per line on standard input; each answer is one line:
//   raw PIPE MODE    open the benchmark's raw pipe and, on a thread of its
//                    own, echo every message (MODE echo) or read them all
//                    and answer only 1-byte messages with 1 byte (MODE sink)
//                                                      -> "ok raw" / "error raw ERR"
//   bus PIPE         build bus "bench" joined to the process serving PIPE;
//                    echo messages with id 1 on "bench" back with id 2,
//                    and count what arrives on "vorbel_service"
//                                                      -> "ok bus" / "error bus"
//   watch print      print "+ ID TICKS" / "- ID TICKS" for every listener of
//                    another process that appears / goes  -> "ok watch"
//   watch count N    print "all N TICKS" when the other processes' listeners
//                    number N                              -> "ok watch"
// A caller waits for "ok watch" before it changes any listener: the
// notifications run on the bus's own thread and would otherwise race the
// command.
//   service          after the queued deliveries: "service pubs=P bytes=B
//                    empty=E removed=R drops=D": listeners messages of other
//                    processes with at least one listener (P, their blob
//                    bytes B), without listeners (E), removed listeners, and
//                    connections the gateway lost after it had one
//   table            "table count=C hash=H": the listeners of other
//                    processes the observer holds, and table_hash of them
//   ask COUNT MS     post COUNT requests (id 1) on "vorbel_service", one
//                    every MS milliseconds, as a peer that asks without
//                    pause                         -> "ok ask ELAPSED_MS"
//   quit             end
// Every TICKS is QueryPerformanceCounter's, comparable across processes.
#include <windows.h>

#include <atomic>
#include <cstdint>
#include <cstdio>
#include <iostream>
#include <memory>
#include <mutex>
#include <sstream>
#include <string>
#include <thread>

#include "bench_main.h"
#include "bench_support.h"
#include "bus/comm/listeners_codec.h"
#include "bus_side.h"
#include "listeners_message_generated.h"
#include "raw_pipe.h"

namespace bench {
namespace {

// What B hears: listener notifications, on the bus's notifier thread.
class watching_observer final : public ibus_observer {
 public:
  void* GetInterface(GUID iid) override {
    return qm::same_iid(iid, IID_ibus_observer) ? static_cast<ibus_observer*>(this) : nullptr;
  }

  void print_each() {
    std::lock_guard<std::mutex> lock(mutex_);
    print_ = true;
    target_ = -1;
  }
  void count_to(long long target) {
    std::lock_guard<std::mutex> lock(mutex_);
    print_ = false;
    target_ = target;
    check_locked(now_ticks());
  }
  long long removed() {
    std::lock_guard<std::mutex> lock(mutex_);
    return removed_;
  }
  std::string table_line() {
    std::lock_guard<std::mutex> lock(mutex_);
    const listener_list held(table_.begin(), table_.end());
    return "table count=" + std::to_string(held.size()) + " hash=" + std::to_string(table_hash(held));
  }

  void on_new_listener(std::uint32_t pid, const char* channel, const char* id) override {
    const std::int64_t at = now_ticks();
    if (pid == ::GetCurrentProcessId()) return;
    std::lock_guard<std::mutex> lock(mutex_);
    table_.insert(listener{channel, id});
    ++held_;
    if (print_) print_line(std::string("+ ") + id + " " + std::to_string(at));
    check_locked(at);
  }
  void on_listener_removed(std::uint32_t pid, const char* channel, const char* id) override {
    const std::int64_t at = now_ticks();
    if (pid == ::GetCurrentProcessId()) return;
    std::lock_guard<std::mutex> lock(mutex_);
    const auto found = table_.find(listener{channel, id});
    if (found != table_.end()) table_.erase(found);
    --held_;
    ++removed_;
    if (print_) print_line(std::string("- ") + id + " " + std::to_string(at));
  }

 private:
  void check_locked(std::int64_t at) {
    if (target_ >= 0 && held_ == target_) {
      print_line("all " + std::to_string(target_) + " " + std::to_string(at));
      target_ = -1;
    }
  }

  std::mutex mutex_;
  bool print_ = false;
  long long target_ = -1;
  long long held_ = 0;
  long long removed_ = 0;
  listener_set table_;
};

// Counts the connections the gateway lost: every disconnect of a process
// that had connected. On the gateway's notification thread.
class connection_counter final : public igateway_observer {
 public:
  void* GetInterface(GUID iid) override {
    return qm::same_iid(iid, IID_igateway_observer) ? static_cast<igateway_observer*>(this) : nullptr;
  }
  void on_listen(const char*) override {}
  void on_local_connect(const char*, std::uint32_t) override {}
  void on_local_disconnect(const char*, std::uint32_t) override { ++drops; }
  void on_local_start_communication(const char*, std::uint32_t) override {}
  void on_local_error(const char*, std::uint32_t, std::uint32_t) override {}
  void on_remote_connect(const char*, std::uint32_t) override {}
  void on_remote_disconnect(const char*, std::uint32_t) override { ++drops; }
  void on_remote_start_communication(const char*, std::uint32_t) override {}
  void on_remote_error(const char*, std::uint32_t, std::uint32_t) override {}
  std::atomic<std::uint64_t> drops{0};
};

// Counts the listeners messages of other processes on "vorbel_service", on
// the delivery thread.
struct service_counter {
  std::atomic<std::uint64_t> publications{0};
  std::atomic<std::uint64_t> bytes{0};
  std::atomic<std::uint64_t> empty{0};

  static void on_message(parlo::message* message, void* context) {
    auto* self = static_cast<service_counter*>(context);
    if (message->message_id() != 2) return;
    std::uint64_t size = 0;
    const void* blob = message->get_blob("params", &size);
    std::uint32_t pid = 0;
    const auto* data = static_cast<const std::uint8_t*>(blob);
    if (blob == nullptr || !comm::verify_listeners(data, static_cast<std::size_t>(size), pid)) return;
    if (pid == ::GetCurrentProcessId()) return;
    if (comm::wire::Getlisteners_message(data)->listeners()->size() == 0) {
      ++self->empty;
      return;
    }
    ++self->publications;
    self->bytes += size;
  }
};

// Echoes "bench" messages with id 1 back with id 2, on the delivery thread.
void echo_message(parlo::message* message, void* context) {
  if (message->message_id() != 1) return;
  auto* side = static_cast<bus_side*>(context);
  parlo::message* reply = message->copy();
  if (reply == nullptr) return;
  reply->set_message_id(2);
  side->channel(bench_channel)->post(reply);
  reply->release();
}

}  // namespace

int run_peer() {
  watching_observer observer;
  connection_counter connections;
  service_counter service;
  std::unique_ptr<bus_side> side;
  winapi::unique_handle raw;  // kept open for the echo thread until exit

  print_line("ready pid=" + std::to_string(::GetCurrentProcessId()));
  std::string line;
  while (std::getline(std::cin, line)) {
    if (!line.empty() && line.back() == '\r') line.pop_back();
    std::istringstream words(line);
    std::string command;
    words >> command;
    if (command == "quit") break;
    if (command == "raw") {
      std::string pipe;
      std::string mode;
      words >> pipe >> mode;
      const DWORD err = raw_pipe_open(pipe, raw);
      if (err != 0) {
        print_line("error raw " + std::to_string(err));
        continue;
      }
      // Detached: it ends when the server closes the pipe, or with the
      // process (a read blocked on a pipe cannot be woken portably).
      std::thread([handle = raw.get(), sink = mode == "sink"] { raw_pipe_echo(handle, sink); }).detach();
      print_line("ok raw");
    } else if (command == "bus") {
      std::string pipe;
      words >> pipe;
      side = std::make_unique<bus_side>();
      const bool built = side->join(pipe) && side->bus()->add_observer(&observer, 0) &&
                         side->gateway() != nullptr && side->gateway()->add_observer(&connections, 0) &&
                         side->subscribe(bench_channel, &echo_message, side.get()) &&
                         side->subscribe("vorbel_service", &service_counter::on_message, &service);
      print_line(built ? "ok bus" : "error bus");
    } else if (command == "watch") {
      std::string mode;
      words >> mode;
      if (mode == "print") {
        observer.print_each();
      } else {
        long long target = 0;
        words >> target;
        observer.count_to(target);
      }
      print_line("ok watch");
    } else if (command == "service") {
      if (side) side->messaging()->flush(10000);
      print_line("service pubs=" + std::to_string(service.publications.load()) +
                 " bytes=" + std::to_string(service.bytes.load()) +
                 " empty=" + std::to_string(service.empty.load()) +
                 " removed=" + std::to_string(observer.removed()) +
                 " drops=" + std::to_string(connections.drops.load()));
    } else if (command == "table") {
      print_line(observer.table_line());
    } else if (command == "ask") {
      int count = 0, period = 1;
      words >> count >> period;
      const std::int64_t start = now_ticks();
      parlo::channel* service_channel = side ? side->channel("vorbel_service") : nullptr;
      for (int i = 0; i < count && service_channel != nullptr; ++i) {
        parlo::message* request = side->messaging()->create_message(0);
        request->set_message_id(1);
        service_channel->post(request);
        request->release();
        ::Sleep(static_cast<DWORD>(period));
      }
      print_line("ok ask " + std::to_string(static_cast<long long>(ticks_to_us(now_ticks() - start) / 1000)));
    } else {
      std::fprintf(stderr, "vorbel_bench peer: unknown command \"%s\"\n", line.c_str());
    }
  }
  if (side) {
    side->bus()->remove_observer(&observer, 0);
    if (side->gateway() != nullptr) side->gateway()->remove_observer(&connections, 0);
  }
  side.reset();
  return 0;
}

}  // namespace bench
