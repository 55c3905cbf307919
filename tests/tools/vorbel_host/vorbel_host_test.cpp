// vorbel_host.exe run as a child process with the real vorbel.dll, parlo.dll
// and scribo.dll beside it; its standard streams are files in the program's
// folder, and every run has a bound.
#include <gtest/gtest.h>

#include <windows.h>

#include <filesystem>
#include <fstream>
#include <iterator>
#include <sstream>
#include <string>
#include <tuple>
#include <vector>

#include "platform/handles.h"
#include "security/signature.h"

std::wstring in_dir(const std::wstring& name) {
  std::wstring path(MAX_PATH, L'\0');
  path.resize(::GetModuleFileNameW(nullptr, &path[0], MAX_PATH));
  return path.substr(0, path.rfind(L'\\') + 1) + name;
}
void write_file(const std::wstring& name, const std::string& text) {
  std::ofstream(std::filesystem::path(in_dir(name)), std::ios::binary | std::ios::trunc) << text;
}
std::string read_file(const std::wstring& name) {
  std::ifstream in(std::filesystem::path(in_dir(name)), std::ios::binary);
  return std::string(std::istreambuf_iterator<char>(in), {});
}

struct run {
  DWORD code = ~0u, pid = 0;
  std::string text;  // standard output and error
};

// Runs vorbel_host.exe with `arguments` and `input` as its standard input.
run run_host(const std::vector<std::wstring>& arguments, const std::string& input = "") {
  write_file(L"in.txt", input);
  SECURITY_ATTRIBUTES inherit{sizeof inherit, nullptr, TRUE};
  auto open = [&](const wchar_t* name, DWORD access, DWORD disposition) {
    return ::CreateFileW(in_dir(name).c_str(), access, FILE_SHARE_READ, &inherit, disposition, 0, nullptr);
  };
  winapi::unique_handle in(open(L"in.txt", GENERIC_READ, OPEN_EXISTING));
  winapi::unique_handle out(open(L"out.txt", GENERIC_WRITE, CREATE_ALWAYS));
  std::wstring command = L"vorbel_host.exe";
  for (const std::wstring& a : arguments) command += L" \"" + a + L"\"";
  STARTUPINFOW startup{};
  startup.cb = sizeof startup;
  startup.dwFlags = STARTF_USESTDHANDLES;
  startup.hStdInput = in.get(), startup.hStdOutput = out.get(), startup.hStdError = out.get();
  PROCESS_INFORMATION info{};
  EXPECT_TRUE(::CreateProcessW(in_dir(L"vorbel_host.exe").c_str(), &command[0], nullptr, nullptr,
                               /* inherit_handles */ TRUE, DETACHED_PROCESS, nullptr, nullptr, &startup, &info));
  winapi::unique_handle process(info.hProcess), thread(info.hThread);
  run result;
  result.pid = info.dwProcessId;
  if (::WaitForSingleObject(process.get(), 30000) != WAIT_OBJECT_0) ::TerminateProcess(process.get(), 99);
  ::GetExitCodeProcess(process.get(), &result.code);  // 99 or STILL_ACTIVE when it hung
  result.text = read_file(L"out.txt");
  return result;
}

TEST(vorbel_host_test, bad_configuration_usage_and_failed_commands_exit_with_their_codes_and_messages) {
  // configuration (written to bad.json and named by --config) or arguments, exit code, message
  const std::tuple<const char*, std::vector<std::wstring>, DWORD, std::string> cases[] = {
      {R"({"bus": "main",)", {}, 2, "not valid JSON: parse error at line 1"},
      {R"({"exported_channel": []})", {}, 2, "exported_channel: unknown field"},
      {R"({"local_channels": ["a\u0000b"]})", {}, 2, "local_channels[0]: must not contain a NUL"},
      {R"({"exported_channels": [{"channel": "a"}]})", {}, 2, "exported_channels[0].pipe: missing"},
      {R"({"exported_channels": [{"channel": "a", "pipe": "p", "link_type": 4294967296}]})", {}, 2,
       "exported_channels[0].link_type: must be a whole number from 0 to 4294967295, found 4294967296"},
      {nullptr, {L"--config", L"none.json"}, 2, "configuration \"none.json\": cannot open the file: err=2"},
      {nullptr, {L"--bogus"}, 2, "unknown option \"--bogus\""},
      {nullptr, {L"--dll-dir", in_dir(L"empty"), L"--exec", L"list"}, 3, "cannot load vorbel.dll from"},
      {nullptr, {L"--exec", L"wait-for a x any 200", L"--exec", L"echo not reached"}, 1, "timed out after 200 ms"},
      {nullptr, {L"--keep-going", L"--exec", L"wait-for a x any 100", L"--exec", L"echo went on"}, 1,
       "wait-for a x any 100: timed out after 100 ms (the listener did not appear)\nwent on"},
  };
  ::CreateDirectoryW(in_dir(L"empty").c_str(), nullptr);
  for (auto [json, arguments, code, message] : cases) {
    if (json != nullptr) {
      write_file(L"bad.json", json);
      arguments = {L"--config", L"bad.json"}, message = "configuration \"bad.json\": " + message;
    }
    const run r = run_host(arguments);
    EXPECT_EQ(r.code, code) << message;
    EXPECT_NE(r.text.find(message), std::string::npos) << message << "\n" << r.text;
    EXPECT_EQ(code == 2, r.text.find("log: ") == std::string::npos) << "bad usage loads nothing\n" << r.text;
    EXPECT_EQ(r.text.find("not reached"), std::string::npos);
  }
}

TEST(vorbel_host_test, help_documents_every_option_command_and_exit_code) {
  const run r = run_host({L"--help"});
  ASSERT_EQ(r.code, 0u);
  for (const char* word :
       {"--config", "--bus", "--dll-dir", "--exec", "--stdin", "--json", "--echo", "--keep-going", "--log",
        "register CH ID", "unregister CH ID", "registered CH ID", "list", "connections", "sleep MS",
        "wait-for CH ID [PID] [TIMEOUT_MS]", "wait-for-absent CH ID", "trust PID|PATH [LEVEL]", "admission local|remote",
        "quit", "exported_channels",
        "imported_channels", "remote_bus", "link_type", "security", "0  every command", "1  a command failed",
        "2  bad usage", "3  vorbel.dll"}) {
    EXPECT_NE(r.text.find(word), std::string::npos) << word;
  }
}

// Notifications come on the bus's notifier thread, so they are checked as
// their own sequence; the waits order them before the lists.
TEST(vorbel_host_test, scripted_run_through_commands_and_notifications_with_the_log_in_a_file) {
  write_file(L"local.json", R"({"bus": "text_bus", "default": true, "local_channels": ["a", "b"]})");
  ::DeleteFileW(in_dir(L"text.log").c_str());  // the log is appended to
  const run r = run_host({L"--config", L"local.json", L"--log", L"text.log"},
                         "register a x\nregister a x\nregister a\x01 x\x7f\xff\nregister b y\nwait-for b y\nlist\n"
                         "registered a y\nunregister a never\nunregister a x\nregistered a x\nunregister a x\n"
                         "registered a x\nwait-for-absent a x\nconnections\nlist\nquit\nregister never reached\n");
  ASSERT_EQ(r.code, 0u) << r.text;
  const std::string pid = std::to_string(r.pid), log_path = std::filesystem::path(in_dir(L"text.log")).string();
  std::string notes, answers;
  std::istringstream lines(r.text);
  for (std::string l; std::getline(lines, l);) (l[0] == '+' || l[0] == '-' ? notes : answers) += l + '\n';
  const std::string ax = "pid=" + pid + " channel=a id=x\n", by = "pid=" + pid + " channel=b id=y\n";
  const std::string odd = "pid=" + pid + " channel=a\\x01 id=x\\x7f\xff\n";  // control bytes escaped
  EXPECT_EQ(notes, "+ " + ax + "+ " + ax + "+ " + odd + "+ " + by + "- " + ax + "- " + ax);
  EXPECT_EQ(answers, "log: " + log_path + "\nready bus=text_bus pid=" + pid + " gateway=no\n" +
                         "wait-for channel=b id=y: found pid=" + pid + "\nlist: 4\n  " + ax + "  " + ax + "  " + odd +
                         "  " + by + "registered channel=a id=y: no\nregistered channel=a id=x: yes\n" +
                         "registered channel=a id=x: no\nwait-for-absent channel=a id=x: absent\n" +
                         "connections: 0 (the bus has no gateway)\nlist: 2\n  " + odd + "  " + by);
  const std::string log = read_file(L"text.log");
  EXPECT_NE(log.find("bus name: text_bus"), std::string::npos) << log;
  EXPECT_NE(log.find("notify_new_listener " + by.substr(0, by.size() - 1)), std::string::npos) << log;
}

// `trust` as an operator types it: a process by pid ("self"), an image by a
// path with blanks in it, as text and as JSON; refused without a gateway or
// with a level other than 0 or 1.
TEST(vorbel_host_test, trust_explains_a_process_or_an_image_and_refuses_what_it_cannot) {
  write_file(L"serving.json", R"({"local_channels": ["a"], "exported_channels": [)"
                              R"({"channel": "a", "pipe": "\\\\.\\PIPE\\vorbel_host_test_trust"}]})");
  write_file(L"alone.json", R"({"local_channels": ["a"]})");
  ::CreateDirectoryW(in_dir(L"with blank").c_str(), nullptr);
  ASSERT_TRUE(::CopyFileW(in_dir(L"vorbel_host.exe").c_str(), in_dir(L"with blank\\copy of host.exe").c_str(), FALSE));
  std::string copy = std::filesystem::path(in_dir(L"with blank\\copy of host.exe")).string();
  std::string quoted_copy;  // as the line quotes it
  for (char c : copy) quoted_copy += c == '\\' ? std::string("\\\\") : std::string(1, c);
  const auto ours = get_current_signature();
  ASSERT_TRUE(ours.has_value()) << "the test program is signed like vorbel_host";
  const std::string signers = "signer=\"" + std::string(ours->subject.begin(), ours->subject.end()) + "\" own_signer=\"" +
                              std::string(ours->subject.begin(), ours->subject.end()) + "\"";
  // Configuration, command, more arguments, exit code, what the output must hold (%PID%: the host's pid).
  const std::tuple<const wchar_t*, std::string, std::wstring, DWORD, std::vector<std::string>> cases[] = {
      {L"serving.json", "trust self 1", L"", 0,
       {"\ntrust ALLOW pid=%PID% level=1 trust=high_trust verification=ERROR_SUCCESS(0x00000000) " + signers +
        " image=\"", "vorbel_host.exe\" source=judged reason=admitted \"admitted\"\n"}},
      {L"serving.json", "trust " + copy + " 0", L"", 0,
       {"\ntrust ALLOW pid=0 level=0 trust=high_trust verification=ERROR_SUCCESS(0x00000000) " + signers +
        " image=\"" + quoted_copy + "\" source=judged"}},
      {L"serving.json", "trust " + copy + "x 1", L"", 0,
       {"\ntrust DENY pid=0 level=1 trust=unknown verification=not_verified", "reason=image_not_judged"}},
      {L"serving.json", "trust self", L"--json", 0,
       {"\n{\"event\":\"trust\",\"verdict\":\"ALLOW\",\"pid\":%PID%,\"level\":0,\"trust\":\"high_trust\","
        "\"verification\":0,\"verification_name\":\"ERROR_SUCCESS\",\"signer\":\""}},
      {L"alone.json", "trust self", L"", 1, {"trust self: the bus has no gateway to explain its admission"}},
      {L"serving.json", "trust 12 7", L"", 2, {"trust: LEVEL must be 0 or 1, not \"7\""}},
      {L"serving.json", "trust", L"", 2, {"usage: trust PID|PATH [LEVEL]"}},
      {L"serving.json", "trust 99999999999", L"", 2, {"trust: PID must be a process id"}},
  };
  for (const auto& [config, command, extra, code, parts] : cases) {
    std::vector<std::wstring> arguments = {L"--config", config, L"--exec", std::wstring(command.begin(), command.end())};
    if (!extra.empty()) arguments.push_back(extra);
    const run r = run_host(arguments);
    EXPECT_EQ(code, r.code) << command << "\n" << r.text;
    for (std::string part : parts) {
      const std::size_t at = part.find("%PID%");
      if (at != std::string::npos) part.replace(at, 5, std::to_string(r.pid));
      EXPECT_NE(std::string::npos, r.text.find(part)) << command << ": " << part << "\n" << r.text;
    }
  }
}
