// What the cross-process benchmarks share: one clock for every process, a
// peer process driven through its standard streams, and a small
// configuration provider.
#pragma once

#include <windows.h>

#include <vorbel/ibus_configuration.h>

#include <chrono>
#include <condition_variable>
#include <cstdint>
#include <functional>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include "bus/listener.h"
#include "platform/handles.h"

namespace bench {

// QueryPerformanceCounter ticks: one counter for every process of the
// machine, so two processes can stamp the two ends of an event and compare.
std::int64_t now_ticks();
double ticks_to_us(std::int64_t ticks);

// Writes one line to standard output at once (several threads may print).
void print_line(const std::string& line);

// This program's own path.
std::wstring own_image();

// A named pipe path "\\.\pipe\vorbel_bench_<tag>_<pid>": unique per run, so
// a run never meets a pipe a crashed earlier run left behind.
std::string pipe_name(const char* tag);

// A peer: this program started again as `vorbel_bench peer`, reading
// commands from its standard input and answering on its standard output.
//
// Owned by the benchmark thread that started it; one reader thread of its
// own collects the peer's lines. send() and the waits may be called from the
// owning thread only; `on_line`, when set before start, runs on the reader
// thread for each line as it arrives.
class peer_process {
 public:
  peer_process() = default;
  peer_process(const peer_process&) = delete;
  peer_process& operator=(const peer_process&) = delete;
  // Asks the peer to quit, and ends it when it does not within 5 s.
  ~peer_process();

  // Starts `image` (this program unless given) as `IMAGE peer`. False (with
  // a line on standard error) when the process cannot start or does not say
  // "ready" within 20 s.
  bool start(const std::wstring& image = own_image());
  DWORD pid() const { return pid_; }

  void send(const std::string& command);
  // The first line not consumed yet that starts with `prefix`, waiting at
  // most `timeout`; it is consumed. Empty on timeout.
  std::string take_line(const std::string& prefix, std::chrono::milliseconds timeout);
  // Sends `command` and takes the reply line that starts with `prefix`.
  std::string request(const std::string& command, const std::string& prefix,
                      std::chrono::milliseconds timeout = std::chrono::seconds(10));

  std::function<void(const std::string&)> on_line;

 private:
  void read_lines();

  winapi::unique_handle input_;
  winapi::unique_handle output_;
  winapi::unique_handle process_;
  DWORD pid_ = 0;
  std::thread reader_;
  std::mutex mutex_;
  std::condition_variable changed_;
  std::vector<std::string> lines_;  // not consumed yet
  bool ended_ = false;
};

// A fixed configuration: local channels, exports (channel, pipe, security 0)
// and imports (channel, pipe, remote bus; the remote channel has the local
// name). Strings live as long as the object.
class fixed_configuration final : public ibus_configuration {
 public:
  struct exported {
    std::string channel;
    std::string pipe;
  };
  struct imported {
    std::string channel;
    std::string pipe;
    std::string remote_bus;
  };

  std::vector<std::string> local;
  std::vector<exported> exports;
  std::vector<imported> imports;

  void* GetInterface(GUID) override { return nullptr; }
  bool is_default_bus() override { return false; }
  bool next_local_channel(std::uint64_t* cursor, const char** channel_name) override;
  bool next_exported_channel(std::uint64_t* cursor, const char** channel_name, const char** pipe_name,
                             std::uint32_t* link_type, std::uint32_t* security) override;
  bool next_imported_channel(std::uint64_t* cursor, const char** channel_name, const char** pipe_name,
                             std::uint32_t* link_type, std::uint32_t* security,
                             const char** remote_channel_name, const char** remote_bus_name) override;
};

// FNV-1a over the listeners of a table in listener order, each as its
// channel, a zero byte, its id and a zero byte: two processes compare
// tables with it.
std::uint64_t table_hash(const listener_list& table);

// Names of the subcommands' own channels and buses.
constexpr const char* bench_bus = "bench";
constexpr const char* bench_channel = "bench";

}  // namespace bench
