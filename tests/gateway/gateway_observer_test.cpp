// The gateway observer as the IPC library's threads see it: admission of
// real peer processes on real pipes, the connections cache, and the
// notifications of the gateway's observers. Built twice: signed like every
// test program, and unsigned, where it must refuse every local connection.
#include <gtest/gtest.h>

#include <windows.h>

#include <mutex>
#include <string>
#include <vector>

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

bool this_program_is_signed() { return get_current_signature().has_value(); }

// A served pipe instance; the helpers' re-protection keeps Wine's
// SetSecurityInfo working on it.
class served_pipe {
 public:
  explicit served_pipe(const std::wstring& name) : handle_(security_test::make_pipe(name.c_str())) {}
  HANDLE get() const { return handle_.get(); }
  void reprotect() const { security_test::reprotect(handle_.get()); }
  DWORD dacl_entries() const { return security_test::dacl_of(handle_.get()).entries(); }

 private:
  winapi::unique_handle handle_;
};

struct event_record {
  std::string event;
  std::string name;
  std::uint32_t pid;
  std::uint32_t err;
  bool operator==(const event_record& o) const {
    return event == o.event && name == o.name && pid == o.pid && err == o.err;
  }
};

void PrintTo(const event_record& e, std::ostream* os) {
  *os << e.event << "(" << e.name << ", " << e.pid << ", " << e.err << ")";
}

class recording_gateway_observer final : public igateway_observer {
 public:
  bool answers = true;
  void* GetInterface(GUID iid) override {
    return answers && qm::same_iid(iid, IID_igateway_observer) ? this : nullptr;
  }
  void on_listen(const char* n) override { add("listen", n, 0, 0); }
  void on_local_connect(const char* n, std::uint32_t pid) override { add("local_connect", n, pid, 0); }
  void on_local_disconnect(const char* n, std::uint32_t pid) override { add("local_disconnect", n, pid, 0); }
  void on_local_start_communication(const char* n, std::uint32_t pid) override { add("local_start", n, pid, 0); }
  void on_local_error(const char* n, std::uint32_t pid, std::uint32_t e) override { add("local_error", n, pid, e); }
  void on_remote_connect(const char* n, std::uint32_t pid) override { add("remote_connect", n, pid, 0); }
  void on_remote_disconnect(const char* n, std::uint32_t pid) override { add("remote_disconnect", n, pid, 0); }
  void on_remote_start_communication(const char* n, std::uint32_t pid) override { add("remote_start", n, pid, 0); }
  void on_remote_error(const char* n, std::uint32_t pid, std::uint32_t e) override { add("remote_error", n, pid, e); }
  std::vector<event_record> take() {
    std::lock_guard<std::mutex> lock(mutex_);
    return std::exchange(events_, {});
  }

 private:
  void add(const char* event, const char* name, std::uint32_t pid, std::uint32_t err) {
    std::lock_guard<std::mutex> lock(mutex_);
    events_.push_back({event, name, pid, err});
  }
  std::mutex mutex_;
  std::vector<event_record> events_;
};

using events = std::vector<event_record>;

// The observer list a gateway would own.
struct observer_list_owner final : qm::observable<igateway_observer_base*, igateway> {
  void* GetInterface(GUID) override { return nullptr; }
};

class gateway_observer_test : public ::testing::Test {
 protected:
  void SetUp() override {
    test_support::clear_log();
    owner.add_observer(&recorder, 0);
    sink.set_pipe_security_map(make_pipe_security_map({
        {"\\\\.\\pipe\\vorbel_obs_level0", 0},  // the documented spelling
        {"\\\\.\\PIPE\\vorbel_obs_level1", 1},
    }));
  }
  // The IPC library's side of a local connection.
  bool connect(const served_pipe& pipe, DWORD pid) {
    const bool admitted = sink.on_local_connect(pipe.get(), pid);
    pipe.reprotect();
    return admitted;
  }
  void listen(const served_pipe& pipe, const char* name) {
    sink.on_listen(pipe.get(), name);
    pipe.reprotect();
  }
  // Every task posted so far has run when this returns.
  std::size_t cached_connections() {
    std::size_t size = 0;
    sink.run_on_worker([&](connections_cache& cache) { size = cache.size(); });
    return size;
  }

  observer_list_owner owner;
  recording_gateway_observer recorder;
  gateway_observer sink{&owner.observer_list()};
  served_pipe level0{L"\\\\.\\pipe\\vorbel_obs_level0"};
  served_pipe level1{L"\\\\.\\pipe\\vorbel_obs_level1"};
  served_pipe unlisted{L"\\\\.\\pipe\\vorbel_obs_unlisted"};
};

TEST(pipe_security_map, prefixes_are_stripped_in_any_letter_case_and_the_first_name_wins) {
  const pipe_security_map map = make_pipe_security_map({
      {"\\\\.\\PIPE\\upper", 1},
      {"\\\\.\\pipe\\lower", 1},
      {"\\\\.\\PiPe\\mixed", 0},
      {"plain", 1},
      {"\\\\.\\PIP", 0},       // too short to carry the prefix: kept as it is
      {"\\\\.\\PIPE\\x", 1},   // orders before "\\x" below and so wins its key
      {"\\x", 0},
  });
  EXPECT_EQ(1u, map.at("\\upper"));
  EXPECT_EQ(1u, map.at("\\lower"));
  EXPECT_EQ(0u, map.at("\\mixed"));
  EXPECT_EQ(1u, map.at("plain"));
  EXPECT_EQ(0u, map.at("\\\\.\\PIP"));
  EXPECT_EQ(1u, map.at("\\x"));
  EXPECT_EQ(6u, map.size());
}

TEST(pipe_security_map, a_pipe_is_found_by_the_name_its_handle_reports) {
  test_support::clear_log();
  served_pipe pipe(L"\\\\.\\pipe\\vorbel_lookup");
  const pipe_security_map map = make_pipe_security_map({{"\\\\.\\pipe\\vorbel_lookup", 1}});
  EXPECT_EQ(std::optional<std::uint32_t>(1), get_pipe_security(map, pipe.get()));
  EXPECT_FALSE(get_pipe_security({{"\\other", 0}}, pipe.get()).has_value());
  EXPECT_FALSE(get_pipe_security(map, reinterpret_cast<HANDLE>(0x4321)).has_value());
  EXPECT_TRUE(has_line(L"get_pipe_security", L"failed get pipe name for handle=17185"));
  EXPECT_TRUE(has_line(L"get_pipe_security", L" \\vorbel_lookup"));
}

TEST_F(gateway_observer_test, admission_follows_the_peers_trust_and_the_pipes_level) {
  if (!this_program_is_signed()) GTEST_SKIP() << "the unsigned build refuses everyone";
  child_process same_signer(image_path(L"child_a"));
  child_process other_signer(image_path(L"child_b"));
  child_process unsigned_peer(image_path(L"child_unsigned"));
  child_process tampered(image_path(L"child_tampered"));
  ASSERT_TRUE(same_signer.running() && other_signer.running() && unsigned_peer.running() &&
              tampered.running());

  EXPECT_TRUE(connect(level0, same_signer.pid()));
  EXPECT_TRUE(connect(level1, same_signer.pid()));
  EXPECT_EQ(6u, level0.dacl_entries()) << "an admitted connection gets the component's DACL";

  EXPECT_FALSE(connect(level0, other_signer.pid()));
  EXPECT_TRUE(connect(level1, other_signer.pid()));
  EXPECT_FALSE(connect(level0, other_signer.pid())) << "refused from the cache too";
  EXPECT_TRUE(has_line(L"gateway_observer::is_allowed_process", L"found it in cache, trust=low_trust"));

  for (const child_process* peer : {&unsigned_peer, &tampered}) {
    EXPECT_FALSE(connect(level1, peer->pid()));
    EXPECT_FALSE(connect(level0, peer->pid()));
  }
  EXPECT_EQ(2u, find_lines(L"gateway_observer::is_allowed_process", L"found it in cache, trust=untrusted").size());
  const std::wstring denied = L"DENY pid=" + std::to_wstring(other_signer.pid()) +
                              L" reason: check process security failed";
  EXPECT_EQ(2u, find_lines(L"gateway_observer::is_allowed", denied).size());

  EXPECT_FALSE(connect(unlisted, same_signer.pid()));
  EXPECT_TRUE(has_line(L"gateway_observer::is_allowed",
                       L"DENY pid=" + std::to_wstring(same_signer.pid()) +
                           L" reason: can't find the pipe in config"));
  // Three admissions on two handles: a handle is one connection.
  EXPECT_EQ(2u, cached_connections()) << "only admitted connections are cached";
}

TEST_F(gateway_observer_test, a_process_that_cannot_be_inspected_is_refused_and_not_cached) {
  if (!this_program_is_signed()) GTEST_SKIP() << "the unsigned build refuses everyone";
  EXPECT_FALSE(connect(level1, 0xFFFFFFF8));
  const auto lines = find_lines(L"gateway_observer::is_allowed_process", L"get_process_info failed err=win_error:");
  ASSERT_EQ(1u, lines.size()) << test_support::dump_log();
  EXPECT_NE(std::wstring::npos, lines[0].text.find(L"OpenProcess failed"));
  EXPECT_FALSE(connect(level1, 0xFFFFFFF8));
  EXPECT_EQ(2u, find_lines(L"gateway_observer::is_allowed_process", L"get_process_info failed").size());
}

TEST_F(gateway_observer_test, the_unsigned_build_refuses_every_local_connection) {
  if (this_program_is_signed()) GTEST_SKIP() << "only the unsigned build has no signature";
  child_process same_signer(image_path(L"child_a"));
  EXPECT_FALSE(connect(level0, same_signer.pid()));
  EXPECT_FALSE(connect(level1, same_signer.pid()));
  EXPECT_EQ(2u, find_lines(L"gateway_observer::is_allowed",
                           L"current process signature is invalid => DENY ALL").size());
  EXPECT_TRUE(sink.on_remote_connect(level0.get(), same_signer.pid())) << "remote connections are unaffected";
  EXPECT_EQ(1u, cached_connections());
}

TEST_F(gateway_observer_test, connect_then_disconnect_notifies_with_name_and_pid_and_empties_the_cache) {
  if (!this_program_is_signed()) GTEST_SKIP();
  child_process peer(image_path(L"child_a"));
  ASSERT_TRUE(connect(level0, peer.pid()));
  sink.on_local_start_communication(level0.get());
  sink.on_local_error(level0.get(), 109);
  sink.on_local_disconnect(level0.get());
  EXPECT_EQ(0u, cached_connections());
  const events expected = {
      {"local_connect", "\\vorbel_obs_level0", peer.pid(), 0},
      {"local_start", "\\vorbel_obs_level0", peer.pid(), 0},
      {"local_error", "\\vorbel_obs_level0", peer.pid(), 109},
      {"local_disconnect", "\\vorbel_obs_level0", peer.pid(), 0},
  };
  EXPECT_EQ(expected, recorder.take());

  const std::wstring handle = std::to_wstring(reinterpret_cast<std::uintptr_t>(level0.get()));
  const auto line = find_lines(L"notify_on_local_connect_handler::task::operator ()", L"");
  ASSERT_EQ(1u, line.size());
  EXPECT_EQ(L"notify on_local_connect pipe=" + handle + L" pipe_name=\\vorbel_obs_level0 remote_pid=" +
                std::to_wstring(peer.pid()),
            line[0].text);
  EXPECT_TRUE(has_line(L"notify_on_local_error_handler::task::operator ()", L" err=109"));
  EXPECT_TRUE(has_line(L"connections_cache::insert",
                       L"connections_cache::insert pipe=" + handle + L" name=\\vorbel_obs_level0 pid=" +
                           std::to_wstring(peer.pid())));
  EXPECT_TRUE(has_line(L"connections_cache::rem", L"connections_cache::rem pipe=" + handle));
}

TEST_F(gateway_observer_test, remote_connections_need_no_admission_and_events_of_unknown_pipes_carry_nothing) {
  recording_gateway_observer silent;  // passed over: it does not answer
  silent.answers = false;
  owner.add_observer(&silent, 0);
  EXPECT_TRUE(sink.on_remote_connect(unlisted.get(), 777));
  sink.on_remote_start_communication(unlisted.get());
  sink.on_remote_disconnect(unlisted.get());
  sink.on_remote_error(unlisted.get(), 232);  // no longer cached
  sink.on_local_error(level1.get(), 5);       // never connected
  sink.on_local_disconnect(nullptr);           // a null handle posts nothing
  sink.on_remote_start_communication(nullptr);
  EXPECT_EQ(0u, cached_connections());
  const events expected = {
      {"remote_connect", "\\vorbel_obs_unlisted", 777, 0},
      {"remote_start", "\\vorbel_obs_unlisted", 777, 0},
      {"remote_disconnect", "\\vorbel_obs_unlisted", 777, 0},
      {"remote_error", "", 0, 232},
      {"local_error", "", 0, 5},
  };
  EXPECT_EQ(expected, recorder.take());
  EXPECT_TRUE(silent.take().empty());
  owner.remove_observer(&silent, 0);
  EXPECT_TRUE(has_line(L"gateway_observer::on_local_disconnect", L"handle=0"));
}

TEST_F(gateway_observer_test, listen_passes_the_given_name_and_applies_the_dacl) {
  listen(level1, "\\\\.\\pipe\\as_given");
  listen(level1, nullptr);
  cached_connections();
  EXPECT_EQ((events{{"listen", "\\\\.\\pipe\\as_given", 0, 0}, {"listen", "", 0, 0}}), recorder.take());
  EXPECT_EQ(6u, level1.dacl_entries());
}

TEST(connections_cache, a_repeated_insert_keeps_the_first_entry) {
  connections_cache cache;
  const HANDLE pipe = reinterpret_cast<HANDLE>(0x40);
  cache.insert(pipe, "\\first", 1);
  cache.insert(pipe, "\\second", 2);
  const connection_info info = cache.get(pipe);
  EXPECT_STREQ("\\first", info.name);
  EXPECT_EQ(6u, info.length);
  EXPECT_EQ(1u, info.pid);
  EXPECT_TRUE(cache.rem(pipe));
  EXPECT_FALSE(cache.rem(pipe));
  const connection_info gone = cache.get(pipe);
  EXPECT_STREQ("", gone.name);
  EXPECT_EQ(0u, gone.pid);
}

}  // namespace
