// Admission of real peer processes on real pipes by the gateway observer.
// Built twice: signed like every test program, and unsigned, where it must
// refuse every local connection.
#include <gtest/gtest.h>

#include <windows.h>

#include <atomic>
#include <chrono>
#include <string>
#include <thread>

#include "gateway/gateway_observer.h"
#include "platform/observable.h"
#include "security/images.h"
#include "security/pipes.h"
#include "security/signature.h"
#include "support/admission_recorder.h"
#include "support/log_capture.h"

namespace {

using namespace std::chrono_literals;
using security_test::child_process;
using security_test::image_path;
using test_support::admission_recorder;
using test_support::find_lines;
using test_support::has_line;
using test_support::heard;

std::string narrow(const std::wstring& ascii) { return std::string(ascii.begin(), ascii.end()); }
std::string our_signer() {
  const auto current = get_current_signature();
  return current ? narrow(current->subject) : std::string();
}

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

// Decisions reach the observers that offer the admission face, on the
// worker, in the order taken, an admitted connection's before its connect
// notification; the others are passed over. The facts are values taken when
// deciding: the worker here runs only after the peer has exited and the
// pipes are closed.
TEST_F(gateway_observer_test, decisions_reach_admission_observers_on_the_worker_as_values) {
  if (!get_current_signature()) GTEST_SKIP() << "the unsigned build refuses everyone";
  admission_recorder plain, both;
  plain.offers_admission = false;
  ASSERT_TRUE(owner.add_observer(&plain, 0) && owner.add_observer(&both, 0));
  std::atomic<bool> holding{false};
  winapi::unique_handle release(::CreateEventW(nullptr, /* manual_reset */ TRUE, /* initial_state */ FALSE, nullptr));
  std::thread holder([&] {
    sink.run_on_worker([&](connections_cache&) {
      holding = true;
      ::WaitForSingleObject(release.get(), 60000);
    });
  });
  ASSERT_TRUE(test_support::wait_until([&] { return holding.load(); }, 10s)) << "the worker never ran the holder";
  const std::wstring image = image_path(L"child_b");
  DWORD pid = 0;
  {
    child_process peer(image);
    ASSERT_TRUE(peer.running());
    pid = peer.pid();
    EXPECT_TRUE(connect(level1, pid)) << "another signer on level 1";
    EXPECT_FALSE(connect(level0, pid)) << "another signer on level 0, from the cache";
  }  // the peer exits
  level0.reset();
  level1.reset();
  ::SetEvent(release.get());
  holder.join();
  sink.run_on_worker([](connections_cache&) {});

  const std::vector<heard> seen = both.seen();
  ASSERT_EQ(3u, seen.size()) << "admission, connect, admission";
  EXPECT_EQ("admission", seen[0].kind);
  EXPECT_EQ("connect", seen[1].kind) << "the admitted connection's notification after its decision";
  EXPECT_EQ("admission", seen[2].kind);
  // Side, pipe, level, verdict, source, reason: the two decisions.
  const std::tuple<const char*, std::uint32_t, bool, gateway_admission_source, gateway_admission_reason> expected[] = {
      {"\\vorbel_obs_level1", 1, true, gateway_admission_source::judged, gateway_admission_reason::admitted},
      {"\\vorbel_obs_level0", 0, false, gateway_admission_source::cached_process,
       gateway_admission_reason::other_signer},
  };
  for (int i = 0; i < 2; ++i) {
    const heard& h = seen[i * 2];
    const auto& [pipe, level, allowed, source, reason] = expected[i];
    EXPECT_EQ(gateway_admission_side::local, h.side);
    EXPECT_EQ(pid, h.pid);
    EXPECT_EQ(pipe, h.pipe);
    EXPECT_EQ(level, h.level);
    EXPECT_EQ(allowed, h.allowed);
    EXPECT_EQ(source, h.source);
    EXPECT_EQ(reason, h.reason) << h.reason_text;
    EXPECT_EQ(0u, h.verification);
    EXPECT_EQ("ERROR_SUCCESS", h.verification_name);
    EXPECT_EQ(VORBEL_SIGNER_B_SUBJECT, h.signer);
    EXPECT_EQ(our_signer(), h.own_signer);
    EXPECT_EQ(gateway_admission_trust::low_trust, h.trust);
    EXPECT_EQ(0, _stricmp(narrow(image).c_str(), h.image.c_str())) << h.image;
    EXPECT_NE(::GetCurrentThreadId(), h.thread) << "on the worker, not the deciding thread";
    EXPECT_EQ(seen[1].thread, h.thread) << "the thread of the connect notification";
  }
  const std::vector<heard> connections_only = plain.seen();
  ASSERT_EQ(1u, connections_only.size()) << "an observer without the face hears only the connect";
  EXPECT_EQ("connect", connections_only[0].kind);
  owner.remove_observer(&both, 0);
  owner.remove_observer(&plain, 0);
}

// An explanation runs the admission's judgement and agrees with the
// decision taken, but neither reads the trust cache (a cached process is
// judged afresh) nor adds to it.
TEST_F(gateway_observer_test, an_explanation_judges_like_admission_and_leaves_the_trust_cache_alone) {
  if (!get_current_signature()) GTEST_SKIP() << "the unsigned build refuses everyone";
  struct row {
    const wchar_t* image;
    bool level0, level1;
    trust_level trust;
    const char* verification;
    std::wstring signer;
  };
  const row rows[] = {
      {L"child_a", true, true, trust_level::high_trust, "ERROR_SUCCESS", get_current_signature()->subject},
      {L"child_b", false, true, trust_level::low_trust, "ERROR_SUCCESS", L"" VORBEL_SIGNER_B_SUBJECT},
      {L"child_unsigned", false, false, trust_level::untrusted, "TRUST_E_NOSIGNATURE", L""},
      {L"child_tampered", false, false, trust_level::untrusted, "TRUST_E_BAD_DIGEST", L""},
  };
  for (const row& r : rows) {
    SCOPED_TRACE(narrow(r.image));
    child_process peer(image_path(r.image));
    ASSERT_TRUE(peer.running());
    const std::size_t cached = sink.trusted_process_count();
    auto agrees = [&](const admission_facts& f, std::uint32_t level) {
      EXPECT_EQ(gateway_admission_side::explanation, f.side);
      EXPECT_EQ(level == 0 ? r.level0 : r.level1, f.allowed) << "level " << level;
      EXPECT_EQ(r.trust, f.trust);
      EXPECT_EQ(r.verification, verification_name(f.verification));
      EXPECT_EQ(r.signer, f.signer);
      EXPECT_EQ(gateway_admission_source::judged, f.source) << "judged afresh, not from the cache";
    };
    agrees(sink.explain_process(peer.pid(), 0), 0);
    agrees(sink.explain_process(peer.pid(), 1), 1);
    EXPECT_EQ(cached, sink.trusted_process_count()) << "explanations add nothing to the cache";
    EXPECT_EQ(r.level1, connect(level1, peer.pid())) << "the decision taken";
    EXPECT_EQ(cached + 1, sink.trusted_process_count()) << "the decision cached the process";
    agrees(sink.explain_process(peer.pid(), 1), 1);
    const admission_facts by_path = sink.explain_image(image_path(r.image), 0);
    agrees(by_path, 0);
    EXPECT_EQ(0u, by_path.pid);
  }
  // What cannot be judged, and why.
  const admission_facts gone = sink.explain_process(0xFFFFFFF8, 1);
  EXPECT_FALSE(gone.allowed);
  EXPECT_EQ(gateway_admission_reason::process_not_inspected, gone.reason);
  const admission_facts missing = sink.explain_image(image_path(L"child_missing"), 1);
  EXPECT_EQ(gateway_admission_reason::image_not_judged, missing.reason);
  EXPECT_EQ(trust_evidence::not_verified, missing.verification);
  EXPECT_TRUE(has_line(L"gateway_observer::admission", L"DENY side=explain pid=0 level=1 image=")) << "its line";
}

TEST_F(gateway_observer_test, the_unsigned_build_explains_every_refusal_by_its_own_missing_signer) {
  if (get_current_signature()) GTEST_SKIP() << "only the unsigned build has no signature";
  child_process ours(image_path(L"child_a"));
  for (const admission_facts& f : {sink.explain_process(ours.pid(), 1), sink.explain_image(image_path(L"child_a"), 1)}) {
    EXPECT_FALSE(f.allowed);
    EXPECT_EQ(gateway_admission_reason::no_own_signer, f.reason);
    EXPECT_TRUE(f.own_signer.empty());
  }
}

}  // namespace

