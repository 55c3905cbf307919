// The scribo.dll stand-in, loaded and called the way the component does, its
// lines read back from the files and pipes it writes.
#include <gtest/gtest.h>

#include <windows.h>

#include <algorithm>
#include <cstdint>
#include <cstdlib>
#include <functional>
#include <map>
#include <regex>
#include <string>
#include <thread>
#include <vector>

#include "platform/handles.h"

namespace {

// The exports, resolved once; null where missing.
struct scribo_api {
  HMODULE module = ::LoadLibraryW(L"scribo.dll");
  template <typename Fn>
  Fn get(const char* name) const {
    return module == nullptr ? nullptr
                             : reinterpret_cast<Fn>(
                                   reinterpret_cast<void*>(::GetProcAddress(module, name)));
  }
  void (*init)() = get<void (*)()>("LogInit");
  void (*deinit)() = get<void (*)()>("LogDeinit");
  void (*uninit_metrics)() = get<void (*)()>("LogUninitMetrics");
  void (*remove_module)(const char*) = get<void (*)(const char*)>("LogRemoveModule");
  using write_fn = std::int32_t (*)(std::int16_t, const std::uint32_t*, HMODULE, const wchar_t*,
                                    const wchar_t*, ...);
  write_fn write = get<write_fn>("LogWrite");
};

const scribo_api& api() {
  static const scribo_api loaded;
  return loaded;
}

void write(std::int16_t step, std::uint32_t level, const wchar_t* function, const wchar_t* text) {
  api().write(step, &level, ::GetModuleHandleW(nullptr), function, L"%s", text);
}

void set_env(const wchar_t* name, const std::wstring* value) {
  ::SetEnvironmentVariableW(name, value != nullptr ? value->c_str() : nullptr);
}
void set_env(const wchar_t* name, const std::wstring& value) { set_env(name, &value); }

std::string read_all(const std::wstring& path) {
  winapi::unique_handle file(::CreateFileW(path.c_str(), GENERIC_READ,
                                           FILE_SHARE_READ | FILE_SHARE_WRITE | FILE_SHARE_DELETE,
                                           nullptr, OPEN_EXISTING, 0, nullptr));
  if (file.get() == INVALID_HANDLE_VALUE) {
    (void)file.release();
    return std::string();
  }
  std::string bytes;
  std::vector<char> buffer(1 << 16);
  DWORD n = 0;
  while (::ReadFile(file.get(), buffer.data(), static_cast<DWORD>(buffer.size()), &n, nullptr) &&
         n > 0) {
    bytes.append(buffer.data(), n);
  }
  return bytes;
}

// One line as written: "YYYY-MM-DD hh:mm:ss.mmm [pid:tid] LEVEL <indent>rest".
struct parsed_line {
  SYSTEMTIME time{};
  DWORD pid = 0;
  DWORD tid = 0;
  std::string level;
  std::size_t indent = 0;
  std::string rest;
};

// The head is matched on its own: a line may be megabytes long.
bool parse_line(const std::string& s, parsed_line* out) {
  static const std::regex head(
      R"(^(\d{4})-(\d\d)-(\d\d) (\d\d):(\d\d):(\d\d)\.(\d{3}) \[(\d+):(\d+)\] (.{5}) )");
  const std::string start = s.substr(0, 80);
  std::smatch m;
  if (!std::regex_search(start, m, head)) return false;
  WORD* fields[] = {&out->time.wYear,   &out->time.wMonth,  &out->time.wDay,
                    &out->time.wHour,   &out->time.wMinute, &out->time.wSecond,
                    &out->time.wMilliseconds};
  for (int i = 0; i < 7; ++i) *fields[i] = static_cast<WORD>(std::stoi(m[i + 1]));
  out->pid = std::stoul(m[8]);
  out->tid = std::stoul(m[9]);
  out->level = m[10];
  const std::size_t at = static_cast<std::size_t>(m.length(0));
  const std::size_t text = s.find_first_not_of(' ', at);
  out->indent = (text == std::string::npos ? s.size() : text) - at;
  out->rest = s.substr(at + out->indent);
  return true;
}

// The lines of a log, each ended by CR LF.
std::vector<parsed_line> parse_log(const std::string& bytes) {
  std::vector<parsed_line> lines;
  std::size_t at = 0;
  while (at < bytes.size()) {
    const std::size_t end = bytes.find("\r\n", at);
    if (end == std::string::npos) {
      ADD_FAILURE() << "unterminated last line: " << bytes.substr(at, 200);
      break;
    }
    parsed_line line;
    if (!parse_line(bytes.substr(at, end - at), &line)) {
      ADD_FAILURE() << "unparsable line: " << bytes.substr(at, std::min<std::size_t>(end - at, 200));
    }
    lines.push_back(std::move(line));
    at = end + 2;
  }
  return lines;
}

std::uint64_t ticks(const SYSTEMTIME& time) {
  FILETIME ft{};
  ::SystemTimeToFileTime(&time, &ft);
  return (static_cast<std::uint64_t>(ft.dwHighDateTime) << 32) | ft.dwLowDateTime;
}

std::wstring current_dir() {
  wchar_t dir[MAX_PATH] = {};
  ::GetCurrentDirectoryW(MAX_PATH, dir);
  return dir;
}

// Each test logs into a file of its own, named after the test.
class scribo_log : public ::testing::Test {
 protected:
  void SetUp() override {
    ASSERT_NE(nullptr, api().module) << "scribo.dll not found beside the test";
    ASSERT_TRUE(api().init && api().deinit && api().uninit_metrics && api().remove_module &&
                api().write) << "an export is missing";
    const std::string name = ::testing::UnitTest::GetInstance()->current_test_info()->name();
    path_ = current_dir() + L"\\" + std::wstring(name.begin(), name.end()) + L".log";
    ::DeleteFileW(path_.c_str());
    set_env(L"SCRIBO_LOG_FILE", path_);
    set_env(L"SCRIBO_LOG_LEVEL", nullptr);
    api().init();
  }
  void TearDown() override {
    api().deinit();
    ::DeleteFileW(path_.c_str());
    set_env(L"SCRIBO_LOG_FILE", nullptr);
    set_env(L"SCRIBO_LOG_LEVEL", nullptr);
  }

  std::vector<parsed_line> lines() const { return parse_log(read_all(path_)); }

  // Runs `body` with the log on a pipe in place of standard error and gives
  // back what reached the pipe; the log then returns to this test's file.
  std::string capture_stderr(const std::wstring& log_file, const std::function<void()>& body) {
    HANDLE read_end = nullptr;
    HANDLE write_end = nullptr;
    if (!::CreatePipe(&read_end, &write_end, nullptr, /* size */ 1 << 20)) {
      ADD_FAILURE() << "CreatePipe err=" << ::GetLastError();
      return std::string();
    }
    winapi::unique_handle reader(read_end);
    winapi::unique_handle writer(write_end);
    const HANDLE saved = ::GetStdHandle(STD_ERROR_HANDLE);
    ::SetStdHandle(STD_ERROR_HANDLE, writer.get());
    api().deinit();
    set_env(L"SCRIBO_LOG_FILE", log_file);
    api().init();
    body();
    api().deinit();  // lets go of the pipe before it closes
    ::SetStdHandle(STD_ERROR_HANDLE, saved);
    writer.reset();
    std::string bytes;
    char buffer[4096];
    DWORD n = 0;
    while (::ReadFile(reader.get(), buffer, sizeof buffer, &n, nullptr) && n > 0) {
      bytes.append(buffer, n);
    }
    set_env(L"SCRIBO_LOG_FILE", path_);
    api().init();
    return bytes;
  }

  std::wstring path_;
};

TEST_F(scribo_log, a_line_has_time_ids_level_function_and_formatted_text) {
  SYSTEMTIME before{};
  ::GetLocalTime(&before);
  write(0, 16, L"gateway::start", L"pipe %d %s 100%");
  const std::uint32_t trace = 32;
  api().write(-1, &trace, nullptr, L"gateway::start", L"<- %s [%d]", L"gateway::start()", 42);
  SYSTEMTIME after{};
  ::GetLocalTime(&after);

  const auto log = lines();  // readable while the log is still open
  ASSERT_EQ(2u, log.size());
  EXPECT_GE(ticks(log[0].time), ticks(before)) << "earlier than the call";
  EXPECT_LE(ticks(log[1].time), ticks(after));
  EXPECT_LE(ticks(log[0].time), ticks(log[1].time));
  EXPECT_EQ(::GetCurrentProcessId(), log[0].pid);
  EXPECT_EQ(::GetCurrentThreadId(), log[0].tid);
  EXPECT_EQ("INFO ", log[0].level);
  EXPECT_EQ(0u, log[0].indent);
  EXPECT_EQ("gateway::start: pipe %d %s 100%", log[0].rest) << "the argument is not a format";
  EXPECT_EQ("TRACE", log[1].level);
  EXPECT_EQ("gateway::start: <- gateway::start() [42]", log[1].rest) << "%s takes a wide string";
}

TEST_F(scribo_log, levels_are_named_and_odd_arguments_still_make_a_line) {
  for (std::uint32_t level : {1u, 2u, 4u, 8u, 16u, 32u, 64u, 48u}) write(0, level, L"f", L"x");
  api().write(0, nullptr, nullptr, nullptr, nullptr);
  write(0, 16, L"", L"no function");
  api().uninit_metrics();
  api().remove_module(nullptr);
  api().remove_module("logging::CLogDLL::~CLogDLL");

  const auto log = lines();
  ASSERT_EQ(10u, log.size());
  const char* names[] = {"FATAL", "CRIT ", "ERROR", "WARN ", "INFO ", "TRACE", "L64  ", "L48  "};
  for (std::size_t i = 0; i < 8; ++i) EXPECT_EQ(names[i], log[i].level);
  EXPECT_EQ("?    ", log[8].level);
  EXPECT_EQ("", log[8].rest);
  EXPECT_EQ("no function", log[9].rest);
}

TEST_F(scribo_log, text_is_utf8_whole_however_long_and_one_call_stays_one_line) {
  std::wstring text = L"caf\u00E9 \u20AC \U0001F600 ";
  text += static_cast<wchar_t>(0xD800);  // a surrogate without its pair
  text += L"x a\r\nb\tc\r\n\r\n";
  write(0, 8, L"f", text.c_str());
  std::wstring long_text(1000000, L'\0');
  for (std::size_t i = 0; i < long_text.size(); ++i)
    long_text[i] = static_cast<wchar_t>(L'a' + i % 26);
  long_text.back() = L'!';
  const std::wstring function(70000, L'F');
  write(0, 16, function.c_str(), long_text.c_str());

  const auto log = lines();
  ASSERT_EQ(2u, log.size());
  EXPECT_EQ("f: caf\xC3\xA9 \xE2\x82\xAC \xF0\x9F\x98\x80 \xEF\xBF\xBDx a  b\tc", log[0].rest);
  EXPECT_EQ(std::string(function.begin(), function.end()) + ": " +
                std::string(long_text.begin(), long_text.end()),
            log[1].rest);
}

TEST_F(scribo_log, indentation_follows_each_threads_own_depth) {
  write(1, 32, L"outer", L"-> outer()");
  write(0, 16, L"outer", L"in outer");
  std::thread([] { write(0, 16, L"other", L"other thread"); }).join();
  write(1, 32, L"inner", L"-> inner()");
  write(0, 16, L"inner", L"in inner");
  write(-1, 32, L"inner", L"<- inner() [0]");
  write(-1, 32, L"outer", L"<- outer() [0]");
  write(-1, 32, L"stray", L"<- stray() [0]");  // an exit without entry stays at the margin
  write(0, 16, L"after", L"after");

  const auto log = lines();
  ASSERT_EQ(9u, log.size());
  const std::size_t expected[] = {0, 2, 0, 2, 4, 2, 0, 0, 0};
  for (std::size_t i = 0; i < 9; ++i) EXPECT_EQ(expected[i], log[i].indent) << log[i].rest;
  EXPECT_NE(log[0].tid, log[2].tid);
}

TEST_F(scribo_log, threads_writing_at_once_give_whole_lines) {
  constexpr int thread_count = 8;
  constexpr int per_thread = 300;
  std::vector<std::thread> threads;
  for (int t = 0; t < thread_count; ++t) {
    threads.emplace_back([t] {
      for (int n = 0; n < per_thread; ++n) {
        const std::wstring body(static_cast<std::size_t>((t * 131 + n * 17) % 3000),
                                static_cast<wchar_t>(L'a' + t));
        const std::wstring text =
            L"t=" + std::to_wstring(t) + L" n=" + std::to_wstring(n) + L" " + body + L" end";
        write(n % 2 == 0 ? 1 : -1, 16, L"burst", text.c_str());
      }
    });
  }
  for (auto& thread : threads) thread.join();

  const auto log = lines();
  ASSERT_EQ(static_cast<std::size_t>(thread_count * per_thread), log.size());
  std::map<int, int> next;   // thread -> next expected n
  std::map<DWORD, int> who;  // thread id -> thread
  for (const auto& line : log) {
    // "burst: t=<t> n=<n> <body> end"
    const std::size_t t_at = line.rest.find("t=");
    const std::size_t n_at = line.rest.find(" n=");
    ASSERT_TRUE(t_at != std::string::npos && n_at != std::string::npos) << line.rest.substr(0, 80);
    const int t = std::atoi(line.rest.c_str() + t_at + 2);
    const int n = std::atoi(line.rest.c_str() + n_at + 3);
    ASSERT_TRUE(t >= 0 && t < thread_count);
    const std::string body(static_cast<std::size_t>((t * 131 + n * 17) % 3000),
                           static_cast<char>('a' + t));
    EXPECT_EQ("burst: t=" + std::to_string(t) + " n=" + std::to_string(n) + " " + body + " end",
              line.rest);
    EXPECT_EQ(next[t]++, n) << "lines of one thread out of order";
    // Each thread's entries and exits pair up, so only another thread's
    // depth could indent its lines.
    EXPECT_EQ(0u, line.indent) << "depth of another thread leaked in";
    if (!who.count(line.tid)) who[line.tid] = t;
    EXPECT_EQ(who[line.tid], t);
  }
}

TEST_F(scribo_log, lines_are_appended_to_what_the_file_held) {
  api().deinit();
  {
    winapi::unique_handle file(::CreateFileW(path_.c_str(), GENERIC_WRITE, 0, nullptr,
                                             CREATE_ALWAYS, 0, nullptr));
    DWORD n = 0;
    ::WriteFile(file.get(), "earlier run\r\n", 13, &n, nullptr);
  }
  write(0, 16, L"f", L"first, before any LogInit");
  api().init();  // opened again: appends, never truncates
  write(0, 16, L"f", L"second");
  const std::string bytes = read_all(path_);
  ASSERT_EQ(0u, bytes.rfind("earlier run\r\n", 0));
  const auto log = parse_log(bytes.substr(13));
  ASSERT_EQ(2u, log.size());
  EXPECT_EQ("f: first, before any LogInit", log[0].rest);
  EXPECT_EQ("f: second", log[1].rest);
}

TEST_F(scribo_log, log_level_setting_keeps_the_more_important_levels) {
  const struct {
    const wchar_t* setting;
    std::vector<std::uint32_t> written;
    bool note;
  } cases[] = {
      {L"16", {2, 4, 8, 16}, false},        {L"info", {2, 4, 8, 16}, false},
      {L" Warning ", {2, 4, 8}, false},     {L"0x4", {2, 4}, false},
      {L"critical", {2}, false},            {L"trace", {2, 4, 8, 16, 32}, false},
      {L"all", {2, 4, 8, 16, 32}, false},   {L"off", {}, false},
      {L"0", {}, false},                    {L"verbose", {2, 4, 8, 16, 32}, true},
      {L"-1", {2, 4, 8, 16, 32}, true},     {L"16x", {2, 4, 8, 16, 32}, true},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(std::string(c.setting, c.setting + std::wcslen(c.setting)));
    api().deinit();
    ::DeleteFileW(path_.c_str());
    set_env(L"SCRIBO_LOG_LEVEL", std::wstring(c.setting));
    api().init();
    for (std::uint32_t level : {2u, 4u, 8u, 16u, 32u}) {
      write(0, level, L"f", (L"level " + std::to_wstring(level)).c_str());
    }
    auto log = lines();
    if (c.note) {
      ASSERT_FALSE(log.empty());
      EXPECT_EQ("WARN ", log[0].level);
      EXPECT_EQ(0u, log[0].rest.rfind("scribo: SCRIBO_LOG_LEVEL \"", 0)) << log[0].rest;
      log.erase(log.begin());
    }
    ASSERT_EQ(c.written.size(), log.size());
    for (std::size_t i = 0; i < log.size(); ++i) {
      EXPECT_EQ("f: level " + std::to_string(c.written[i]), log[i].rest);
    }
  }
}

TEST_F(scribo_log, a_dash_or_a_file_that_cannot_open_writes_to_standard_error) {
  auto log = parse_log(capture_stderr(L"-", [] { write(0, 4, L"f", L"to stderr"); }));
  ASSERT_EQ(1u, log.size());
  EXPECT_EQ("ERROR", log[0].level);
  EXPECT_EQ("f: to stderr", log[0].rest);
  EXPECT_TRUE(lines().empty());

  const std::wstring missing = current_dir() + L"\\no_such_folder\\x.log";
  log = parse_log(capture_stderr(missing, [] { write(0, 16, L"f", L"still here"); }));
  ASSERT_EQ(2u, log.size());
  EXPECT_EQ("scribo: cannot open log file \"" + std::string(missing.begin(), missing.end()) +
                "\" err=3; writing to standard error",
            log[0].rest);
  EXPECT_EQ("f: still here", log[1].rest);
}

TEST_F(scribo_log, without_a_setting_the_log_goes_to_a_temp_file_named_after_the_program) {
  api().deinit();
  set_env(L"SCRIBO_LOG_FILE", nullptr);
  api().init();
  write(0, 16, L"f", L"in temp");
  api().deinit();
  wchar_t temp[MAX_PATH + 1] = {};
  ::GetTempPathW(MAX_PATH + 1, temp);
  const std::wstring expected = std::wstring(temp) + L"scribo\\scribo_test-" +
                                std::to_wstring(::GetCurrentProcessId()) + L".log";
  const auto log = parse_log(read_all(expected));
  ::DeleteFileW(expected.c_str());
  ASSERT_EQ(1u, log.size()) << std::string(expected.begin(), expected.end());
  EXPECT_EQ("f: in temp", log[0].rest);
  set_env(L"SCRIBO_LOG_FILE", path_);
  api().init();
}

}  // namespace
