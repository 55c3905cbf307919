// Benchmark 5: admission of a signed peer process: one classification that
// reads and verifies the peer image's signature (nothing cached) against one
// decision answered from the trust cache.
#include <windows.h>
#include <psapi.h>

#include <cstdio>
#include <functional>
#include <memory>
#include <vector>

#include "bench_main.h"
#include "bench_support.h"
#include "gateway/gateway_observer.h"
#include "logging/logger.h"
#include "platform/win_api.h"
#include "security/process_trust.h"
#include "stats.h"

namespace bench {

int run_admission() {
  constexpr int uncached_samples = 25;
  constexpr int cached_samples = 500;
  peer_process peer;
  if (!peer.start()) return 1;
  const std::uint32_t pid = peer.pid();

  gateway_observer_list observers;
  std::vector<double> uncached_us;
  for (int i = 0; i < uncached_samples; ++i) {
    // A fresh observer has an empty trust cache.
    gateway_observer observer(&observers);
    const std::int64_t start = now_ticks();
    const bool allowed = observer.is_allowed_process(pid, 0);
    uncached_us.push_back(ticks_to_us(now_ticks() - start));
    if (!allowed) {
      std::fprintf(stderr, "vorbel_bench: the peer, signed like this program, was refused\n");
      return 1;
    }
  }

  gateway_observer observer(&observers);
  observer.is_allowed_process(pid, 0);  // classifies and caches
  std::vector<double> cached_us;
  for (int i = 0; i < cached_samples; ++i) {
    const std::int64_t start = now_ticks();
    observer.is_allowed_process(pid, 0);
    cached_us.push_back(ticks_to_us(now_ticks() - start));
  }

  // What a cached decision cannot avoid: the process's identity as the
  // kernel records it, which is the cache key (open, creation time, image
  // path).
  constexpr DWORD identity_access = PROCESS_QUERY_LIMITED_INFORMATION | SYNCHRONIZE;
  std::vector<double> identity_us;
  for (int i = 0; i < cached_samples; ++i) {
    const std::int64_t start = now_ticks();
    HANDLE process = ::OpenProcess(identity_access, FALSE, pid);
    FILETIME times[4];
    wchar_t path[MAX_PATH];
    DWORD size = MAX_PATH;
    if (process != nullptr) {
      ::GetProcessTimes(process, &times[0], &times[1], &times[2], &times[3]);
      ::QueryFullProcessImageNameW(process, 0, path, &size);
      ::CloseHandle(process);
    }
    identity_us.push_back(ticks_to_us(now_ticks() - start));
  }

  // Probes of the cached path's parts, with the component's own calls.
  auto median_us = [&](const std::function<void()>& op) {
    std::vector<double> samples;
    for (int i = 0; i < cached_samples; ++i) {
      const std::int64_t start = now_ticks();
      op();
      samples.push_back(ticks_to_us(now_ticks() - start));
    }
    return summarize(samples);
  };
  const summary info_part = median_us([&] {
    winapi::unique_handle process = winapi::open_process(identity_access, pid);
    get_process_info(pid, process.get());
  });
  // The three system calls one by one, and the path as read from the
  // process's own memory (which a process may rewrite, so no longer used),
  // on a handle opened once.
  winapi::unique_handle probe_handle =
      winapi::open_process(PROCESS_QUERY_INFORMATION | PROCESS_VM_READ, pid);
  const summary open_part = median_us([&] {
    HANDLE h = ::OpenProcess(identity_access, FALSE, pid);
    if (h != nullptr) ::CloseHandle(h);
  });
  const summary times_part = median_us([&] {
    FILETIME t[4];
    ::GetProcessTimes(probe_handle.get(), &t[0], &t[1], &t[2], &t[3]);
  });
  const summary module_part = median_us([&] {
    wchar_t path[MAX_PATH];
    ::K32GetModuleFileNameExW(probe_handle.get(), nullptr, path, MAX_PATH);
  });
  const summary image_part = median_us([&] {
    wchar_t path[MAX_PATH];
    DWORD size = MAX_PATH;
    ::QueryFullProcessImageNameW(probe_handle.get(), 0, path, &size);
  });
  processes_trust_cache cache;
  const process_info key = [&] {
    winapi::unique_handle process = winapi::open_process(identity_access, pid);
    return get_process_info(pid, process.get());
  }();
  cache.add(key, winapi::open_process(SYNCHRONIZE, pid), trust_level::high_trust);
  const summary find_part = median_us([&] { cache.find(key); });
  const summary log_part = median_us([] {
    logging::trace_scope trace(L"vorbel_bench::probe");
    logging::logger_stream(logging::level_info, L"vorbel_bench::probe")
        << L"found it in cache, trust=" << trust_level_name(trust_level::high_trust);
  });

  const summary u = summarize(uncached_us);
  const summary c = summarize(cached_us);
  const summary id = summarize(identity_us);
  std::printf("## 5. Admission of a signed peer\n\n");
  std::printf("gateway_observer::is_allowed_process for a running peer signed like this program, pipe "
              "level 0. Uncached: a fresh observer each time (%d samples); cached: the same observer "
              "after one classification (%d samples). The process-identity row is the bare system calls "
              "that every decision makes to form the cache key. %s.\n\n",
              uncached_samples, cached_samples, logging_setting().c_str());
  std::printf("| decision | median µs | p99 µs | median / cached |\n");
  std::printf("|---|---:|---:|---:|\n");
  std::printf("| uncached (signature read and verified) | %.0f | %.0f | %.0f |\n", u.p50, u.p99, u.p50 / c.p50);
  std::printf("| cached | %.1f | %.1f | 1.00 |\n", c.p50, c.p99);
  std::printf("| process identity only (OpenProcess, GetProcessTimes, QueryFullProcessImageNameW) | %.1f | %.1f "
              "| %.2f |\n\n",
              id.p50, id.p99, id.p50 / c.p50);
  std::printf("Where a cached decision's time goes (medians of the component's own calls):\n\n");
  std::printf("| part | median µs | p99 µs |\n|---|---:|---:|\n");
  std::printf("| open_process + get_process_info (the cache key) | %.1f | %.1f |\n", info_part.p50, info_part.p99);
  std::printf("| - OpenProcess + CloseHandle | %.1f | %.1f |\n", open_part.p50, open_part.p99);
  std::printf("| - GetProcessTimes | %.1f | %.1f |\n", times_part.p50, times_part.p99);
  std::printf("| - QueryFullProcessImageNameW | %.1f | %.1f |\n", image_part.p50, image_part.p99);
  std::printf("| (for comparison: K32GetModuleFileNameExW, which reads the process's own memory; not used) | "
              "%.1f | %.1f |\n",
              module_part.p50, module_part.p99);
  std::printf("| processes_trust_cache::find | %.1f | %.1f |\n", find_part.p50, find_part.p99);
  std::printf("| trace_scope and one logger_stream line | %.1f | %.1f |\n\n", log_part.p50, log_part.p99);
  std::printf("- cached decision under 10 µs: %s (%.1f µs)\n\n", verdict_below(c.p50, 10).c_str(), c.p50);
  return 0;
}

}  // namespace bench
