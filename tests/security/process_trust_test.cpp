// Trust classification on real signed images, and the trust cache with
// events standing in for processes (signalled = exited) and with real peers.
#include <gtest/gtest.h>

#include <windows.h>
#include <winternl.h>

#include <chrono>
#include <future>
#include <thread>
#include <vector>

#include "platform/win_api.h"
#include "security/images.h"
#include "security/process_trust.h"
#include "support/log_capture.h"

namespace {

using security_test::child_process;
using security_test::image_path;
using test_support::has_line;
using test_support::wait_until;

process_info key(std::uint32_t low, std::uint32_t pid = 100, const wchar_t* path = L"C:\\p.exe",
                 std::uint32_t high = 1) {
  return process_info{FILETIME{low, high}, pid, path};
}

// Handles open on the object behind `handle`, the test's own included.
ULONG handle_count(HANDLE handle) {
  PUBLIC_OBJECT_BASIC_INFORMATION info{};
  if (::NtQueryObject(handle, ObjectBasicInformation, &info, sizeof(info), nullptr) != 0) return 0;
  return info.HandleCount;
}

// Manual-reset events that stand in for processes; the cache gets a
// duplicate of each, so the test can see when the cache closes its own.
struct fake_processes {
  std::vector<winapi::unique_handle> events;
  explicit fake_processes(std::size_t n) {
    for (std::size_t i = 0; i < n; ++i) events.emplace_back(::CreateEventW(nullptr, TRUE, FALSE, nullptr));
  }
  winapi::unique_handle duplicate(std::size_t i) const {
    HANDLE copy = nullptr;
    ::DuplicateHandle(::GetCurrentProcess(), events[i].get(), ::GetCurrentProcess(), &copy, 0, FALSE,
                      DUPLICATE_SAME_ACCESS);
    return winapi::unique_handle(copy);
  }
  void add(processes_trust_cache& cache, std::size_t i, trust_level trust) const {
    cache.add(key(static_cast<std::uint32_t>(i)), duplicate(i), trust);
  }
  bool closed_by_cache(std::size_t i) const { return handle_count(events[i].get()) == 1; }
};

std::wstring quoted(const std::wstring& path) {
  std::wstring text = L"\"";
  for (wchar_t c : path) {
    if (c == L'\\' || c == L'"') text += L'\\';
    text += c;
  }
  return text + L"\"";
}

TEST(process_info_test, orders_by_creation_time_then_pid_then_path) {
  EXPECT_TRUE(key(0xFFFFFFFF, 9, L"C:\\z", 1) < key(0, 1, L"C:\\a", 2));  // high half first
  EXPECT_TRUE(key(1) < key(0x80000000));                                   // unsigned low half
  EXPECT_TRUE(key(5, 7) < key(5, 8));
  // Pid reuse: same pid, another creation time, another key.
  EXPECT_TRUE(key(5, 7) < key(6, 7) || key(6, 7) < key(5, 7));
  EXPECT_TRUE(key(5, 7, L"C:\\a\\b.exe") < key(5, 7, L"C:\\a\\c.exe"));
  // Both slashes separate elements: the same path either way.
  EXPECT_FALSE(key(5, 7, L"C:\\a\\b.exe") < key(5, 7, L"C:/a/b.exe"));
  EXPECT_FALSE(key(5, 7, L"C:/a/b.exe") < key(5, 7, L"C:\\a\\b.exe"));
}

TEST(get_process_info_test, throws_with_the_system_code) {
  try {
    get_process_info(1, nullptr);
    FAIL() << "no exception";
  } catch (const std::system_error& e) {
    EXPECT_EQ(e.code().value(), static_cast<int>(ERROR_INVALID_HANDLE));
    EXPECT_EQ(std::string(e.what()).rfind("GetProcessTimes failed", 0), 0u) << e.what();
  }
}

class signature_checker_test : public ::testing::Test {
 protected:
  void SetUp() override { test_support::clear_log(); }
  signature_checker checker_{get_current_signature()};
};

TEST_F(signature_checker_test, classifies_images_against_our_signer) {
  ASSERT_TRUE(checker_.has_signature());
  EXPECT_EQ(checker_.get_process_trust(image_path(L"child_a")), trust_level::high_trust);
  EXPECT_EQ(checker_.get_process_trust(image_path(L"child_case")), trust_level::high_trust);
  EXPECT_EQ(checker_.get_process_trust(image_path(L"child_b")), trust_level::low_trust);
  EXPECT_EQ(checker_.get_process_trust(image_path(L"child_serial")), trust_level::low_trust);
}

TEST_F(signature_checker_test, refusals_say_why) {
  const std::wstring unsigned_image = image_path(L"child_unsigned");
  EXPECT_EQ(checker_.get_process_trust(unsigned_image), trust_level::untrusted);
  EXPECT_TRUE(has_line(L"signature_checker::check_low_security", L"not trusted " + quoted(unsigned_image)))
      << test_support::dump_log();

  const std::wstring tampered = image_path(L"child_tampered");
  EXPECT_FALSE(checker_.check_low_security(tampered));
  EXPECT_TRUE(has_line(L"signature_checker::check_low_security",
                       L"failed is_trusted for " + quoted(tampered) + L" err=-2146869232"))
      << test_support::dump_log();

  // Verifies, but its signer has no name: low trust, not high.
  EXPECT_EQ(checker_.get_process_trust(image_path(L"child_noname")), trust_level::low_trust);
  const auto lines = test_support::find_lines(L"signature_checker::get_process_trust", L"get_signature err=1168");
  ASSERT_EQ(lines.size(), 1u) << test_support::dump_log();
  EXPECT_EQ(lines[0].level, 8u);
}

TEST_F(signature_checker_test, a_checker_without_our_signer_never_grants_high_trust) {
  signature_checker none{std::nullopt};
  EXPECT_FALSE(none.has_signature());
  EXPECT_EQ(none.get_process_trust(image_path(L"child_a")), trust_level::low_trust);
  signature_checker nameless{signature{L"01", L"Root", L""}};
  EXPECT_FALSE(nameless.has_signature());
  EXPECT_EQ(nameless.get_process_trust(image_path(L"child_noname")), trust_level::low_trust);
}

class trust_cache_test : public ::testing::Test {
 protected:
  void SetUp() override { test_support::clear_log(); }
  void TearDown() override {
    EXPECT_FALSE(has_line(L"processes_trust_cache::monitor", L"WaitForMultipleObjects err="))
        << test_support::dump_log();
  }
};

TEST_F(trust_cache_test, finds_each_level_and_keeps_the_first_entry_of_a_key) {
  fake_processes p(6);
  processes_trust_cache cache;
  p.add(cache, 0, trust_level::high_trust);
  p.add(cache, 1, trust_level::low_trust);
  p.add(cache, 2, trust_level::untrusted);
  EXPECT_EQ(cache.find(key(0)), trust_level::high_trust);
  EXPECT_EQ(cache.find(key(1)), trust_level::low_trust);
  EXPECT_EQ(cache.find(key(2)), trust_level::untrusted);
  EXPECT_EQ(cache.find(key(3)), trust_level::unknown);

  // Same key again: the first entry stays, the new handle is closed at once.
  cache.add(key(1), p.duplicate(3), trust_level::low_trust);
  EXPECT_EQ(cache.count(trust_level::low_trust), 1u);
  EXPECT_TRUE(p.closed_by_cache(3));
  EXPECT_FALSE(p.closed_by_cache(1));
  // unknown is never stored.
  p.add(cache, 4, trust_level::unknown);
  EXPECT_EQ(cache.find(key(4)), trust_level::unknown);
  EXPECT_TRUE(p.closed_by_cache(4));
  // A null handle would break the wait for every entry: refused.
  cache.add(key(5), winapi::unique_handle(), trust_level::high_trust);
  EXPECT_EQ(cache.find(key(5)), trust_level::unknown);
  EXPECT_TRUE(has_line(L"processes_trust_cache::add", L"null process handle for pid=100"));
  EXPECT_EQ(cache.size(), 3u);
  EXPECT_TRUE(cache.monitoring());
}

TEST_F(trust_cache_test, exit_removes_the_entry_from_its_own_map) {
  fake_processes p(7);
  processes_trust_cache cache;
  for (std::size_t i = 0; i < 3; ++i) p.add(cache, i, trust_level::high_trust);
  for (std::size_t i = 3; i < 5; ++i) p.add(cache, i, trust_level::low_trust);
  for (std::size_t i = 5; i < 7; ++i) p.add(cache, i, trust_level::untrusted);
  // The first entry of each map sits on a boundary of the wait list.
  for (std::size_t i : {3u, 5u, 0u, 6u}) {
    ::SetEvent(p.events[i].get());
    ASSERT_TRUE(wait_until([&] { return cache.find(key(static_cast<std::uint32_t>(i))) == trust_level::unknown; }))
        << "entry " << i;
    EXPECT_TRUE(wait_until([&] { return p.closed_by_cache(i); }));
  }
  EXPECT_EQ(cache.count(trust_level::high_trust), 2u);
  EXPECT_EQ(cache.count(trust_level::low_trust), 1u);
  EXPECT_EQ(cache.count(trust_level::untrusted), 0u);
}

TEST_F(trust_cache_test, full_cache_trims_each_map_to_its_newest_16) {
  fake_processes p(63);
  processes_trust_cache cache;
  for (std::size_t i = 0; i < 40; ++i) p.add(cache, i, trust_level::high_trust);
  for (std::size_t i = 40; i < 60; ++i) p.add(cache, i, trust_level::low_trust);
  for (std::size_t i = 60; i < 62; ++i) p.add(cache, i, trust_level::untrusted);
  EXPECT_EQ(cache.size(), 62u);

  p.add(cache, 62, trust_level::high_trust);
  EXPECT_EQ(cache.size(), 35u);
  EXPECT_EQ(cache.count(trust_level::high_trust), 17u);
  EXPECT_EQ(cache.count(trust_level::low_trust), 16u);
  EXPECT_EQ(cache.count(trust_level::untrusted), 2u);
  EXPECT_EQ(cache.find(key(23)), trust_level::unknown);  // oldest go first
  EXPECT_EQ(cache.find(key(24)), trust_level::high_trust);
  EXPECT_EQ(cache.find(key(43)), trust_level::unknown);
  EXPECT_EQ(cache.find(key(44)), trust_level::low_trust);
  EXPECT_EQ(cache.find(key(60)), trust_level::untrusted);
  // The monitoring thread closes the 28 evicted handles after rebuilding.
  EXPECT_TRUE(wait_until([&] { return cache.pending_close_count() == 0; }));
  for (std::size_t i = 0; i < 44; ++i) {
    if (i < 24 || i >= 40) {
      EXPECT_TRUE(wait_until([&] { return p.closed_by_cache(i); })) << i;
    }
  }
  EXPECT_FALSE(p.closed_by_cache(24));
}

TEST_F(trust_cache_test, eviction_during_a_wait_never_breaks_the_wait) {
  constexpr std::size_t total = 1000;
  fake_processes p(total + 1);
  processes_trust_cache cache;
  for (std::size_t i = 0; i < 62; ++i) p.add(cache, i, trust_level::high_trust);
  // Once the newest entry's exit is seen, the monitor waits on a list that
  // holds the oldest ones, which the next trims evict.
  ::SetEvent(p.events[61].get());
  ASSERT_TRUE(wait_until([&] { return cache.find(key(61)) == trust_level::unknown; }));

  // Keep trimming while evicted and live "processes" exit under the wait.
  std::thread exits([&] {
    for (std::size_t i = 0; i < total; i += 3) ::SetEvent(p.events[i].get());
  });
  for (std::size_t i = 62; i < total; ++i) p.add(cache, i, (i % 2) ? trust_level::high_trust : trust_level::low_trust);
  exits.join();

  EXPECT_TRUE(cache.monitoring());
  EXPECT_TRUE(wait_until([&] { return cache.pending_close_count() == 0; }));
  EXPECT_LE(cache.size(), processes_trust_cache::max_handles);
  // Still watching: a new entry's exit is still noticed.
  p.add(cache, total, trust_level::high_trust);
  ASSERT_EQ(cache.find(key(static_cast<std::uint32_t>(total))), trust_level::high_trust);
  ::SetEvent(p.events[total].get());
  EXPECT_TRUE(wait_until([&] { return cache.find(key(static_cast<std::uint32_t>(total))) == trust_level::unknown; }));
  // Every handle that left the cache has been closed.
  for (std::size_t i = 0; i <= total; ++i) {
    if (cache.find(key(static_cast<std::uint32_t>(i))) == trust_level::unknown) {
      EXPECT_TRUE(wait_until([&] { return p.closed_by_cache(i); })) << i;
    }
  }
}

TEST_F(trust_cache_test, destruction_while_waiting_stops_the_thread_and_closes_handles) {
  fake_processes p(10);
  auto cache = std::make_unique<processes_trust_cache>();
  for (std::size_t i = 0; i < 10; ++i) p.add(*cache, i, trust_level::low_trust);
  ASSERT_TRUE(wait_until([&] { return cache->wait_rounds() >= 1; }));

  auto destroyed = std::async(std::launch::async, [&] { cache.reset(); });
  ASSERT_EQ(destroyed.wait_for(std::chrono::seconds(10)), std::future_status::ready);
  for (std::size_t i = 0; i < 10; ++i) EXPECT_TRUE(p.closed_by_cache(i)) << i;
}

TEST_F(trust_cache_test, real_process_is_read_and_cached_until_it_exits) {
  FILETIME before{};
  ::GetSystemTimeAsFileTime(&before);
  const std::wstring path = image_path(L"child_a");
  child_process child(path);
  ASSERT_TRUE(child.running());
  FILETIME after{};
  ::GetSystemTimeAsFileTime(&after);
  const process_info info = get_process_info(child.pid(), winapi::open_process(0x410, child.pid()).get());
  EXPECT_EQ(info.pid, child.pid());
  EXPECT_EQ(::CompareStringOrdinal(info.image_path.c_str(), -1, path.c_str(), -1, TRUE), CSTR_EQUAL)
      << info.image_path.wstring();
  auto ticks = [](const FILETIME& t) { return (std::uint64_t{t.dwHighDateTime} << 32) | t.dwLowDateTime; };
  constexpr std::uint64_t slack = 200 * 10000;  // 200 ms in 100 ns units: clock granularity
  EXPECT_GE(ticks(info.creation_time) + slack, ticks(before));
  EXPECT_LE(ticks(info.creation_time), ticks(after) + slack);

  processes_trust_cache cache;
  cache.add(info, winapi::open_process(SYNCHRONIZE, child.pid()), trust_level::high_trust);
  EXPECT_EQ(cache.find(info), trust_level::high_trust);
  // A later process under the same pid is another key.
  process_info reused = info;
  reused.creation_time.dwLowDateTime += 1;
  EXPECT_EQ(cache.find(reused), trust_level::unknown);

  ASSERT_TRUE(child.stop());
  EXPECT_TRUE(wait_until([&] { return cache.find(info) == trust_level::unknown; }));
  EXPECT_EQ(cache.size(), 0u);
}

}  // namespace
