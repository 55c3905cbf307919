// vorbel_host.exe driven as a child process through its standard streams,
// with the real vorbel.dll, parlo.dll and scribo.dll beside it (and beside
// this program). Every wait is bounded; a child that outlives its test is
// terminated.
#include <gtest/gtest.h>

#include <nlohmann/json.hpp>
#include <windows.h>

#include <chrono>
#include <condition_variable>
#include <cstdint>
#include <filesystem>
#include <fstream>
#include <mutex>
#include <optional>
#include <string>
#include <thread>
#include <vector>

#include "platform/handles.h"

namespace {

using namespace std::chrono_literals;

std::wstring program_dir() {
  std::wstring path(MAX_PATH, L'\0');
  path.resize(::GetModuleFileNameW(nullptr, &path[0], MAX_PATH));
  return path.substr(0, path.rfind(L'\\'));
}

using args = std::vector<std::wstring>;

void write_file(const std::wstring& name, const std::string& text) {
  std::ofstream(std::filesystem::path(program_dir() + L"\\" + name), std::ios::binary | std::ios::trunc) << text;
}

// One run of vorbel_host.exe. Its stdout and stderr are read on two threads
// into line buffers; the test reads stdout lines in order.
class host_process {
 public:
  explicit host_process(const args& arguments) {
    SECURITY_ATTRIBUTES inherit{sizeof(inherit), nullptr, TRUE};
    HANDLE ends[6] = {};  // child's stdin, ours; ours, child's stdout; ours, child's stderr
    for (int i = 0; i < 3; ++i) {
      if (!::CreatePipe(&ends[2 * i], &ends[2 * i + 1], &inherit, 0)) {
        ADD_FAILURE() << "CreatePipe err=" << ::GetLastError();
        return;
      }
    }
    winapi::unique_handle child_in(ends[0]), child_out(ends[3]), child_err(ends[5]);
    input_.reset(ends[1]);
    winapi::unique_handle out(ends[2]), err(ends[4]);
    for (HANDLE ours : {ends[1], ends[2], ends[4]}) ::SetHandleInformation(ours, HANDLE_FLAG_INHERIT, 0);

    const std::wstring exe = program_dir() + L"\\vorbel_host.exe";
    std::wstring command = L"\"" + exe + L"\"";
    for (const std::wstring& a : arguments) command += L" \"" + a + L"\"";
    STARTUPINFOW startup{};
    startup.cb = sizeof(startup);
    startup.dwFlags = STARTF_USESTDHANDLES;
    startup.hStdInput = child_in.get();
    startup.hStdOutput = child_out.get();
    startup.hStdError = child_err.get();
    PROCESS_INFORMATION info{};
    if (!::CreateProcessW(exe.c_str(), &command[0], /* process security */ nullptr,
                          /* thread security */ nullptr, /* inherit_handles */ TRUE, DETACHED_PROCESS,
                          /* environment */ nullptr, /* current_directory */ nullptr, &startup, &info)) {
      ADD_FAILURE() << "CreateProcess err=" << ::GetLastError();
      return;
    }
    process_.reset(info.hProcess);
    ::CloseHandle(info.hThread);
    pid_ = info.dwProcessId;
    readers_[0] = std::thread([this, h = out.release()] { pump(h, out_); });
    readers_[1] = std::thread([this, h = err.release()] { pump(h, err_); });
  }
  ~host_process() {
    if (exit_code(10s) == 99999 && process_) {
      ::TerminateProcess(process_.get(), 99);
      join();
    }
  }

  std::uint32_t pid() const { return pid_; }
  void send(const std::string& line) {
    const std::string text = line + "\n";
    DWORD written = 0;
    ASSERT_TRUE(::WriteFile(input_.get(), text.data(), static_cast<DWORD>(text.size()), &written, nullptr));
  }
  // The next stdout line, or "<timeout>".
  std::string next_line(std::chrono::milliseconds timeout = 10s) {
    std::unique_lock<std::mutex> lock(mutex_);
    changed_.wait_for(lock, timeout, [&] { return out_.lines.size() > taken_ || out_.closed; });
    return out_.lines.size() > taken_ ? out_.lines[taken_++] : "<timeout>";
  }
  // Exit code once the child has ended (its input closed first), or 99999.
  DWORD exit_code(std::chrono::milliseconds timeout = 20s) {
    input_.reset();
    DWORD code = 99999;
    if (!process_ || ::WaitForSingleObject(process_.get(), static_cast<DWORD>(timeout.count())) != WAIT_OBJECT_0) {
      return code;
    }
    ::GetExitCodeProcess(process_.get(), &code);
    join();
    return code;
  }
  std::vector<std::string> out_lines() {
    std::lock_guard<std::mutex> lock(mutex_);
    return out_.lines;
  }
  std::string err_text() { return joined(err_); }
  std::string all_text() { return joined(out_) + joined(err_); }

 private:
  struct stream {
    std::vector<std::string> lines;
    std::string partial;
    bool closed = false;
  };
  void pump(HANDLE pipe, stream& s) {
    winapi::unique_handle owned(pipe);
    char buffer[4096];
    DWORD n = 0;
    bool more = true;
    while (more) {
      more = ::ReadFile(pipe, buffer, sizeof buffer, &n, nullptr) && n > 0;
      std::lock_guard<std::mutex> lock(mutex_);
      for (DWORD i = 0; more && i < n; ++i) {
        if (buffer[i] != '\n') s.partial += buffer[i];
        else s.lines.push_back(std::exchange(s.partial, {}));
      }
      if (!more && !s.partial.empty()) s.lines.push_back(std::exchange(s.partial, {}));
      s.closed = !more;
      changed_.notify_all();
    }
  }
  void join() {
    for (auto& reader : readers_) {
      if (reader.joinable()) reader.join();
    }
  }
  std::string joined(const stream& s) {
    std::lock_guard<std::mutex> lock(mutex_);
    std::string text;
    for (const auto& l : s.lines) text += l + "\n";
    return text;
  }

  winapi::unique_handle input_, process_;
  std::uint32_t pid_ = 0;
  std::mutex mutex_;
  std::condition_variable changed_;
  stream out_, err_;
  std::size_t taken_ = 0;
  std::thread readers_[2];
};

// Reads stdout up to the ready line (after "log: ...").
void expect_ready(host_process& host, const std::string& bus = "main") {
  EXPECT_EQ(host.next_line().rfind("log: ", 0), 0u);
  ASSERT_EQ(host.next_line(),
            "ready bus=" + bus + " pid=" + std::to_string(host.pid()) + " gateway=no")
      << host.all_text();
}

TEST(vorbel_host_test, bad_configuration_and_usage_exit_before_loading_with_a_message) {
  // A configuration is written to bad.json and named by --config.
  const struct {
    const char* json;
    args arguments;
    DWORD code;
    const char* message;
  } cases[] = {
      {R"({"bus": "main",)", {}, 2, "not valid JSON: parse error at line 1"},
      {R"([])", {}, 2, "the configuration must be a JSON object, found array"},
      {R"({"exported_channel": []})", {}, 2, "exported_channel: unknown field"},
      {R"({"bus": ""})", {}, 2, "bus: must be a non-empty string"},
      {R"({"default": "yes"})", {}, 2, "default: must be true or false"},
      {R"({"local_channels": "a"})", {}, 2, "local_channels: must be an array, found string"},
      {R"({"local_channels": ["a", 7]})", {}, 2, "local_channels[1]: must be a non-empty string, found number"},
      {R"({"local_channels": ["a\u0000b"]})", {}, 2, "local_channels[0]: must not contain a NUL"},
      {R"({"exported_channels": [{"channel": "a"}]})", {}, 2, "exported_channels[0].pipe: missing"},
      {R"({"exported_channels": ["a"]})", {}, 2, "exported_channels[0]: must be an object, found string"},
      {R"({"exported_channels": [{"channel": "a", "pipe": "p", "security": 2}]})", {}, 2,
       "exported_channels[0].security: must be 0 or 1, found 2"},
      {R"({"exported_channels": [{"channel": "a", "pipe": "p", "security": true}]})", {}, 2,
       "exported_channels[0].security: must be 0 or 1, found true"},
      {R"({"imported_channels": [{"channel": "a", "pipe": "p", "remote_channel": "a"}]})", {}, 2,
       "imported_channels[0].remote_bus: missing"},
      {R"({"imported_channels": [{"channel": "a", "pipe": "p", "remote_channel": "a",
           "remote_bus": "b", "link_type": -1}]})", {}, 2,
       "imported_channels[0].link_type: must be a whole number from 0 to 4294967295, found -1"},
      {R"({"imported_channels": [{"channel": "a", "pipe": "p", "remote_channel": "a",
           "remote_bus": "b", "link_type": 4294967296}]})", {}, 2,
       "imported_channels[0].link_type: must be a whole number"},
      {nullptr, {L"--config", L"no_such_file.json"}, 2, "configuration \"no_such_file.json\": cannot open the file: err=2"},
      {nullptr, {L"--bogus"}, 2, "unknown option \"--bogus\""},
      {nullptr, {L"--config"}, 2, "--config needs a value"},
      {nullptr, {L"--json=yes"}, 2, "--json takes no value"},
      {nullptr, {L"--bus="}, 2, "--bus needs a non-empty name"},
      {nullptr, {L"--exec", L"frobnicate a"}, 2, "unknown command \"frobnicate\""},
      {nullptr, {L"--exec", L"register a"}, 2, "usage: register CH ID"},
      {nullptr, {L"--exec", L"sleep 86400001"}, 2, "sleep: MS must be a number of milliseconds from 0 to 86400000"},
      {nullptr, {L"--exec", L"wait-for a x someone"}, 2, "PID must be a process id"},
      {nullptr, {L"--exec", L"wait-for a x any -5"}, 2, "TIMEOUT_MS must be from 0 to 86400000"},
      {nullptr, {L"--dll-dir", program_dir() + L"\\empty", L"--exec", L"list"}, 3, "cannot load vorbel.dll from"},
  };
  ::CreateDirectoryW((program_dir() + L"\\empty").c_str(), nullptr);
  for (const auto& c : cases) {
    args arguments = c.arguments;
    std::string message = c.message;
    if (c.json != nullptr) {
      write_file(L"bad.json", c.json);
      arguments = {L"--config", L"bad.json", L"--exec", L"list"};
      message = "configuration \"bad.json\": " + message;
    }
    host_process host(arguments);
    EXPECT_EQ(host.exit_code(), c.code) << message;
    EXPECT_NE(host.err_text().find(message), std::string::npos) << message << "\n" << host.err_text();
    if (c.code == 2) {
      EXPECT_TRUE(host.out_lines().empty()) << message;  // nothing loaded
    }
  }
}

TEST(vorbel_host_test, help_documents_every_option_command_and_exit_code) {
  host_process host(args{L"--help"});
  ASSERT_EQ(host.exit_code(), 0u);
  const std::string help = host.all_text();
  for (const char* word :
       {"--config", "--bus", "--dll-dir", "--exec", "--stdin", "--json", "--echo", "--keep-going",
        "--log", "register CH ID", "unregister CH ID", "registered CH ID", "list", "connections",
        "sleep MS", "wait-for CH ID [PID] [TIMEOUT_MS]", "wait-for-absent CH ID", "quit",
        "exported_channels", "imported_channels", "remote_bus", "link_type", "security",
        "0  every command", "1  a command failed", "2  bad usage", "3  vorbel.dll"}) {
    EXPECT_NE(help.find(word), std::string::npos) << word;
  }
}

TEST(vorbel_host_test, single_process_register_list_unregister_in_text_with_the_log_in_a_file) {
  const std::wstring log = program_dir() + L"\\text.log";
  ::DeleteFileW(log.c_str());
  write_file(L"local.json", R"({"bus": "text_bus", "default": true, "local_channels": ["a", "b"]})");
  host_process host(args{L"--config", L"local.json", L"--log", L"text.log"});
  EXPECT_EQ(host.next_line(), "log: " + std::string(log.begin(), log.end()));
  const std::string me = std::to_string(host.pid());
  ASSERT_EQ(host.next_line(), "ready bus=text_bus pid=" + me + " gateway=no") << host.all_text();

  const std::string ax = "pid=" + me + " channel=a id=x", by = "pid=" + me + " channel=b id=y";
  const std::pair<const char*, std::vector<std::string>> script[] = {
      {"register a x", {"+ " + ax}},
      {"register a x", {"+ " + ax}},  // a second, equal entry
      {"register b y", {"+ " + by}},
      {"list", {"list: 3", "  " + ax, "  " + ax, "  " + by}},
      {"registered a y", {"registered channel=a id=y: no"}},
      // Unregistering what was never there notifies nothing: the next line
      // is the real removal's.
      {"unregister a never", {}},
      {"unregister a x", {"- " + ax}},
      {"registered a x", {"registered channel=a id=x: yes"}},  // one equal entry is left
      {"unregister a x", {"- " + ax}},
      {"registered a x", {"registered channel=a id=x: no"}},
      {"connections", {"connections: 0 (the bus has no gateway)"}},
      {"list", {"list: 1", "  " + by}},
  };
  for (const auto& [command, expected] : script) {
    host.send(command);
    for (const std::string& line : expected) EXPECT_EQ(host.next_line(), line) << command;
  }
  host.send("quit");
  host.send("register never reached");
  EXPECT_EQ(host.exit_code(), 0u) << host.all_text();
  EXPECT_EQ(host.out_lines().size(), 17u) << host.all_text();  // nothing after quit
  EXPECT_EQ(host.err_text(), "");

  std::ifstream in(std::filesystem::path(log), std::ios::binary);
  const std::string text((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>());
  EXPECT_NE(text.find("bus name: text_bus"), std::string::npos) << text;
  EXPECT_NE(text.find("notify_new_listener " + by), std::string::npos) << text;
}

TEST(vorbel_host_test, exported_channel_gives_the_bus_a_gateway_that_is_observed) {
  // A pipe of this run's own; nobody connects, so the only gateway event is
  // the pipe's listen, which may come before or after the host's own lines.
  const std::string pipe = "\\\\.\\PIPE\\vorbel_host_test_" + std::to_string(::GetCurrentProcessId());
  const nlohmann::json config = {
      {"local_channels", {"a"}},
      {"exported_channels", {{{"channel", "a"}, {"pipe", pipe}, {"link_type", 1}, {"security", 1}}}}};
  write_file(L"export.json", config.dump());
  host_process host(args{L"--config", L"export.json", L"--exec", L"connections", L"--exec",
                         L"register a x", L"--exec", L"wait-for a x"});
  ASSERT_EQ(host.exit_code(), 0u) << host.all_text();
  std::vector<std::string> lines;
  for (const std::string& line : host.out_lines()) {
    if (line.rfind("listen ", 0) != 0) lines.push_back(line);
  }
  const std::string me = std::to_string(host.pid());
  ASSERT_EQ(lines.size(), 5u) << host.all_text();
  EXPECT_EQ(lines[1], "ready bus=main pid=" + me + " gateway=yes");
  EXPECT_EQ(lines[2], "connections: 0");
  EXPECT_EQ(lines[3], "+ pid=" + me + " channel=a id=x");
  EXPECT_EQ(host.err_text(), "");
}

TEST(vorbel_host_test, json_mode_prints_one_object_per_line) {
  // Notifications are asynchronous: each wait orders its notification before
  // the next command's output.
  host_process host(args{L"--json", L"--exec", L"register a x", L"--exec",
                         L"wait-for a x self 5000", L"--exec", L"list", L"--exec",
                         L"registered a x", L"--exec", L"unregister a x", L"--exec",
                         L"wait-for-absent a x any 5000", L"--exec", L"connections"});
  ASSERT_EQ(host.exit_code(), 0u) << host.all_text();
  const std::uint32_t me = host.pid();
  std::vector<nlohmann::json> objects;
  for (const std::string& line : host.out_lines()) {
    objects.push_back(nlohmann::json::parse(line, nullptr, /* allow_exceptions */ false));
    ASSERT_FALSE(objects.back().is_discarded()) << line;
  }
  const std::vector<nlohmann::json> expected = {
      {{"event", "ready"}, {"bus", "main"}, {"pid", me}, {"gateway", false}},
      {{"event", "new_listener"}, {"pid", me}, {"channel", "a"}, {"id", "x"}},
      {{"event", "wait-for"}, {"channel", "a"}, {"id", "x"}, {"pid", me}},
      {{"event", "list"},
       {"processes", {{{"pid", me}, {"listeners", {{{"channel", "a"}, {"id", "x"}}}}}}}},
      {{"event", "registered"}, {"channel", "a"}, {"id", "x"}, {"registered", true}},
      {{"event", "listener_removed"}, {"pid", me}, {"channel", "a"}, {"id", "x"}},
      {{"event", "wait-for-absent"}, {"channel", "a"}, {"id", "x"}},
      {{"event", "connections"}, {"gateway", false}, {"connections", nlohmann::json::array()}},
  };
  ASSERT_EQ(objects.size(), expected.size() + 1) << host.all_text();
  EXPECT_EQ(objects[0]["event"], "log");
  for (std::size_t i = 0; i < expected.size(); ++i) EXPECT_EQ(objects[i + 1], expected[i]) << i;
  // The event name leads each line, for readers that only look at the start.
  EXPECT_EQ(host.out_lines()[2].rfind(R"({"event":"new_listener","pid":)", 0), 0u);
}

TEST(vorbel_host_test, wait_timeouts_exit_1_and_stop_unless_keep_going) {
  {
    const auto start = std::chrono::steady_clock::now();
    host_process host(args{L"--exec", L"wait-for a x any 200", L"--exec", L"echo not reached"});
    EXPECT_EQ(host.exit_code(), 1u);
    EXPECT_GE(std::chrono::steady_clock::now() - start, 200ms);
    EXPECT_NE(host.err_text().find("wait-for a x any 200: timed out after 200 ms"),
              std::string::npos)
        << host.err_text();
    EXPECT_EQ(host.all_text().find("not reached"), std::string::npos);
  }
  {
    // The table is learned from notifications, so the listener is waited
    // for before its absence can time out.
    host_process host(args{L"--keep-going", L"--echo", L"--exec", L"register a x", L"--exec",
                           L"wait-for a x", L"--exec", L"wait-for-absent a x self 100",
                           L"--exec", L"echo went on"});
    EXPECT_EQ(host.exit_code(), 1u);
    EXPECT_NE(host.err_text().find("timed out after 100 ms (the listener is still there)"),
              std::string::npos)
        << host.err_text();
    const auto lines = host.out_lines();
    ASSERT_GE(lines.size(), 2u);
    EXPECT_EQ(lines[lines.size() - 2], "> echo went on") << host.all_text();
    EXPECT_EQ(lines.back(), "went on") << host.all_text();
  }
  {
    // The same rule for standard input: a bad line ends the run with 1.
    host_process host(args{});
    ASSERT_NO_FATAL_FAILURE(expect_ready(host));
    host.send("wait-for a");
    host.send("echo not reached");
    EXPECT_EQ(host.exit_code(), 1u);
    EXPECT_NE(host.err_text().find("usage: wait-for CH ID [PID] [TIMEOUT_MS]"), std::string::npos);
    EXPECT_EQ(host.all_text().find("not reached"), std::string::npos);
  }
}

TEST(vorbel_host_test, names_from_anywhere_stay_on_one_line) {
  // Control bytes are escaped in text; invalid UTF-8 becomes U+FFFD in JSON.
  host_process text(args{});
  ASSERT_NO_FATAL_FAILURE(expect_ready(text));
  text.send(std::string("register a\x01 x\x7f\xff"));
  EXPECT_EQ(text.next_line(), "+ pid=" + std::to_string(text.pid()) + " channel=a\\x01 id=x\\x7f\xff");
  text.send("quit");
  EXPECT_EQ(text.exit_code(), 0u);

  host_process json(args{L"--json"});
  json.send(std::string("register a\x01 x\xff"));
  json.send(std::string("wait-for a\x01 x\xff"));
  json.send("quit");
  ASSERT_EQ(json.exit_code(), 0u) << json.all_text();
  const auto lines = json.out_lines();
  ASSERT_EQ(lines.size(), 4u) << json.all_text();
  const auto object = nlohmann::json::parse(lines[2]);
  EXPECT_EQ(object["channel"], "a\x01");
  EXPECT_EQ(object["id"], "x\xEF\xBF\xBD");
}

}  // namespace
