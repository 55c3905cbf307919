// Trust classification on real signed images, and the trust cache with
// events standing in for processes (signalled = exited).
#include <gtest/gtest.h>

#include <windows.h>
#include <winternl.h>

#include <thread>
#include <vector>

#include "security/images.h"
#include "security/process_trust.h"
#include "support/log_capture.h"

namespace {

using test_support::wait_until;

process_info key(std::size_t i) { return process_info{FILETIME{static_cast<DWORD>(i), 1}, 100, L"C:\\p.exe"}; }

// Manual-reset events that stand in for processes; the cache gets a
// duplicate of each, so the test sees when the cache has closed its own.
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
  void add(processes_trust_cache& cache, std::size_t i, trust_level trust) const { cache.add(key(i), duplicate(i), trust); }
  bool closed_by_cache(std::size_t i) const {
    PUBLIC_OBJECT_BASIC_INFORMATION info{};
    ::NtQueryObject(events[i].get(), ObjectBasicInformation, &info, sizeof(info), nullptr);
    return info.HandleCount == 1;
  }
  bool gone(processes_trust_cache& cache, std::size_t i) const {
    return wait_until([&] { return cache.find(key(i)) == trust_level::unknown && closed_by_cache(i); });
  }
};

TEST(signature_checker_test, classifies_images_against_our_signer) {
  signature_checker ours{get_current_signature()};
  ASSERT_TRUE(ours.has_signature());
  const struct {
    const wchar_t* image;
    trust_level trust;
  } cases[] = {
      {L"child_a", trust_level::high_trust},     {L"child_case", trust_level::high_trust},
      {L"child_b", trust_level::low_trust},      {L"child_noname", trust_level::low_trust},
      {L"child_unsigned", trust_level::untrusted}, {L"child_tampered", trust_level::untrusted},
  };
  for (const auto& c : cases) EXPECT_EQ(ours.get_process_trust(security_test::image_path(c.image)), c.trust) << c.image;
  // An empty signer name never matches, not even a peer without one.
  signature_checker nameless{signature{L"01", L"Root", L""}};
  EXPECT_FALSE(nameless.has_signature());
  EXPECT_EQ(nameless.get_process_trust(security_test::image_path(L"child_noname")), trust_level::low_trust);
}

class trust_cache_test : public ::testing::Test {
 protected:
  void SetUp() override { test_support::clear_log(); }
  void TearDown() override {
    EXPECT_FALSE(test_support::has_line(L"processes_trust_cache::monitor", L"WaitForMultipleObjects err="))
        << test_support::dump_log();
  }
};

TEST_F(trust_cache_test, a_full_cache_trims_each_map_to_its_newest_16_and_exits_still_remove) {
  fake_processes p(63);
  processes_trust_cache cache;
  for (std::size_t i = 0; i < 62; ++i) {  // 40 high, 20 low, 2 untrusted
    p.add(cache, i, i < 40 ? trust_level::high_trust : i < 60 ? trust_level::low_trust : trust_level::untrusted);
  }
  p.add(cache, 62, trust_level::high_trust);
  EXPECT_EQ(cache.count(trust_level::high_trust), 17u);
  EXPECT_EQ(cache.count(trust_level::low_trust), 16u);
  EXPECT_EQ(cache.count(trust_level::untrusted), 2u);
  // The oldest went, and the monitor closed their handles after rebuilding.
  for (std::size_t i : {0u, 23u, 40u, 43u}) EXPECT_TRUE(p.gone(cache, i)) << i;
  EXPECT_EQ(cache.find(key(24)), trust_level::high_trust);
  EXPECT_FALSE(p.closed_by_cache(24));
  // The first entry of each map sits on a boundary of the rebuilt wait list.
  for (std::size_t i : {44u, 60u, 24u}) {
    ::SetEvent(p.events[i].get());
    EXPECT_TRUE(p.gone(cache, i)) << i;
  }
  EXPECT_EQ(cache.size(), 32u);
}

TEST_F(trust_cache_test, eviction_during_a_wait_never_breaks_the_wait) {
  constexpr std::size_t total = 1000;
  fake_processes p(total + 1);
  processes_trust_cache cache;
  for (std::size_t i = 0; i < 62; ++i) p.add(cache, i, trust_level::high_trust);
  // The monitor now waits on a list holding the oldest, which trims evict.
  ::SetEvent(p.events[61].get());
  ASSERT_TRUE(p.gone(cache, 61));
  std::thread exits([&] {
    for (std::size_t i = 0; i < total; i += 3) ::SetEvent(p.events[i].get());
  });
  for (std::size_t i = 62; i < total; ++i) p.add(cache, i, (i % 2) ? trust_level::high_trust : trust_level::low_trust);
  exits.join();

  EXPECT_LE(cache.size(), processes_trust_cache::max_handles);
  p.add(cache, total, trust_level::high_trust);
  ::SetEvent(p.events[total].get());
  EXPECT_TRUE(p.gone(cache, total)) << "still watching";
  for (std::size_t i = 0; i < total; ++i) {
    EXPECT_TRUE(cache.find(key(i)) != trust_level::unknown || p.gone(cache, i)) << i;
  }
}

// A file's verdict holds while a cached process runs the file (the file
// cannot change then) and goes with the last of them, however it leaves:
// exit, trim, or a second add of a process already cached, which must not
// count twice.
TEST_F(trust_cache_test, an_image_verdict_lives_exactly_while_a_cached_process_runs_the_image) {
  fake_processes p(65);
  processes_trust_cache cache;
  image_identity file;
  file.size = 4096;
  file.file_id[0] = 7;
  image_identity rewritten = file;
  rewritten.last_write = 1;
  cache.add(key(0), p.duplicate(0), trust_level::low_trust, file);
  cache.add(key(1), p.duplicate(1), trust_level::low_trust, file);
  cache.add(key(1), p.duplicate(1), trust_level::low_trust, file);  // already cached
  EXPECT_EQ(cache.find_image(file), trust_level::low_trust);
  EXPECT_EQ(cache.find_image(rewritten), trust_level::unknown);
  ::SetEvent(p.events[0].get());
  ASSERT_TRUE(p.gone(cache, 0));
  EXPECT_EQ(cache.find_image(file), trust_level::low_trust) << "process 1 still runs it";
  ::SetEvent(p.events[1].get());
  ASSERT_TRUE(p.gone(cache, 1));
  EXPECT_TRUE(wait_until([&] { return cache.find_image(file) == trust_level::unknown; }));

  // The oldest process, the only one of the file, is trimmed away.
  cache.add(key(2), p.duplicate(2), trust_level::high_trust, file);
  for (std::size_t i = 3; i < 65; ++i) p.add(cache, i, trust_level::high_trust);  // the 63rd trims
  EXPECT_EQ(cache.find(key(2)), trust_level::unknown);
  EXPECT_EQ(cache.find_image(file), trust_level::unknown);
  EXPECT_EQ(cache.image_count(), 0u);
}

}  // namespace
