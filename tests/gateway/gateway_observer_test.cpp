// Admission of real peer processes on real pipes by the gateway observer.
// Built twice: signed like every test program, and unsigned, where it must
// refuse every local connection.
#include <gtest/gtest.h>

#include <windows.h>

#include <string>

#include "gateway/gateway_observer.h"
#include "platform/observable.h"
#include "security/images.h"
#include "security/pipes.h"
#include "security/signature.h"
#include "support/log_capture.h"

namespace {

using security_test::child_process;
using security_test::image_path;
using test_support::find_lines;
using test_support::has_line;

// The observer list a gateway would own; nobody is on it.
struct observer_list_owner final : qm::observable<igateway_observer_base*, igateway> {
  void* GetInterface(GUID) override { return nullptr; }
};

class gateway_observer_test : public ::testing::Test {
 protected:
  void SetUp() override {
    test_support::clear_log();
    // The spelling Windows documents, and the prefix in capitals.
    sink.set_pipe_security_map(
        make_pipe_security_map({{"\\\\.\\pipe\\vorbel_obs_level0", 0}, {"\\\\.\\PIPE\\vorbel_obs_level1", 1}}));
  }
  // The IPC library's side of a local connection, re-protecting the pipe as
  // it does.
  bool connect(const winapi::unique_handle& pipe, DWORD pid) {
    const bool admitted = sink.on_local_connect(pipe.get(), pid);
    security_test::reprotect(pipe.get());
    return admitted;
  }
  std::size_t denials(DWORD pid) {
    return find_lines(L"gateway_observer::is_allowed",
                      L"DENY pid=" + std::to_wstring(pid) + L" reason: check process security failed")
        .size();
  }

  observer_list_owner owner;
  gateway_observer sink{&owner.observer_list()};
  winapi::unique_handle level0 = security_test::make_pipe(L"\\\\.\\pipe\\vorbel_obs_level0");
  winapi::unique_handle level1 = security_test::make_pipe(L"\\\\.\\pipe\\vorbel_obs_level1");
  winapi::unique_handle unlisted = security_test::make_pipe(L"\\\\.\\pipe\\vorbel_obs_unlisted");
};

TEST(pipe_security_map, the_prefix_goes_in_any_letter_case_and_a_name_too_short_for_it_stays) {
  EXPECT_EQ((pipe_security_map{{"\\mixed", 1}, {"\\\\.\\PIP", 0}}),
            make_pipe_security_map({{"\\\\.\\PiPe\\mixed", 1}, {"\\\\.\\PIP", 0}}));
}

// Every trust against every level, decided first and then from the cache:
// each row's image runs twice, one process asking first on level 0, the
// other first on level 1; each then asks again on the same level and on the
// other one, both answered from the cache. A cached answer must be the
// first answer: a low-trust peer admitted on level 0 from the cache would
// open level 0 pipes to every validly signed process.
TEST_F(gateway_observer_test, admission_follows_trust_and_level_first_and_cached) {
  if (!get_current_signature()) GTEST_SKIP() << "the unsigned build refuses everyone";
  struct row {
    const wchar_t* image;
    const wchar_t* trust;  // as the cache line names it
    bool level0, level1;   // admitted?
  };
  const row rows[] = {
      {L"child_a", L"high_trust", true, true},
      {L"child_b", L"low_trust", false, true},
      {L"child_unsigned", L"untrusted", false, false},
      {L"child_tampered", L"untrusted", false, false},
  };
  const winapi::unique_handle* pipes[] = {&level0, &level1};
  for (const row& r : rows) {
    const bool expected[] = {r.level0, r.level1};
    for (int first : {0, 1}) {
      child_process peer(image_path(r.image));
      ASSERT_TRUE(peer.running()) << image_path(r.image).c_str();
      const std::wstring cached_line = std::wstring(L"found it in cache, trust=") + r.trust;
      const std::size_t cached_before = find_lines(L"gateway_observer::is_allowed_process", cached_line).size();
      const std::size_t denials_before = denials(peer.pid());  // Wine reuses pids
      const int order[] = {first, first, 1 - first};  // first decision, then two from the cache
      std::size_t refused = 0;
      for (int step = 0; step < 3; ++step) {
        const int level = order[step];
        EXPECT_EQ(expected[level], connect(*pipes[level], peer.pid()))
            << r.image << " on level " << level << (step == 0 ? " (first decision)" : " (cached decision)");
        refused += expected[level] ? 0 : 1;
      }
      EXPECT_EQ(cached_before + 2, find_lines(L"gateway_observer::is_allowed_process", cached_line).size())
          << r.image << ": the second and third decisions come from the cache";
      EXPECT_EQ(denials_before + refused, denials(peer.pid())) << r.image << ": one DENY line per refusal";
    }
  }
  unique_local_sid holder;
  EXPECT_EQ(8u, security_test::dacl_of(level0.get(), holder)->AceCount) << "the admitted get the component's DACL";

  child_process ours(image_path(L"child_a"));
  EXPECT_FALSE(connect(unlisted, ours.pid()));
  EXPECT_TRUE(has_line(L"gateway_observer::is_allowed",
                       L"DENY pid=" + std::to_wstring(ours.pid()) + L" reason: can't find the pipe in config"));
  EXPECT_FALSE(connect(level1, 0xFFFFFFF8)) << "a process that cannot be inspected";
}

TEST_F(gateway_observer_test, the_unsigned_build_refuses_every_local_connection) {
  if (get_current_signature()) GTEST_SKIP() << "only the unsigned build has no signature";
  child_process ours(image_path(L"child_a"));
  EXPECT_FALSE(connect(level0, ours.pid()));
  EXPECT_TRUE(has_line(L"gateway_observer::is_allowed", L"current process signature is invalid => DENY ALL"));
  // Nor does it join any server, and says so once, however often it tries.
  EXPECT_FALSE(sink.on_remote_connect(level0.get(), ours.pid()));
  EXPECT_FALSE(sink.on_remote_connect(level0.get(), ours.pid()));
  EXPECT_EQ(2u, find_lines(L"gateway_observer::is_allowed", L"DENY ALL").size());
}

}  // namespace
