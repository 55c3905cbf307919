// scribo.dll: the logging library that components load at run time and write
// their diagnostic lines to.
//
// Every LogWrite call becomes one line:
//
//   2026-05-01 12:34:56.788 [1234:5678] TRACE gateway::export_channel: -> gateway::export_channel()
//   2026-05-01 12:34:56.789 [1234:5678] INFO    gateway::export_channel: channel=alerts link_type=3 security=0
//   2026-05-01 12:34:56.790 [1234:5678] TRACE gateway::export_channel: <- gateway::export_channel() [2]
//
// local time to the millisecond, process and thread id, the level's name,
// two blanks per traced operation the calling thread is inside (the depth
// step: +1 after an entry line, -1 before an exit line), the function name
// and the text formatted with the Microsoft wide printf conventions (%s takes
// a wide string).
//
// Where the lines go is read when the log opens (first LogInit, or the first
// line written without one):
//   SCRIBO_LOG_FILE   a file the lines are appended to, UTF-8; "-" is standard
//                     error; unset: %TEMP%\scribo\<exe name>-<pid>.log
//   SCRIBO_LOG_LEVEL  the most verbose level written: a number (16, 0x10) or a
//                     name (critical, error, warning, info, trace, all, off);
//                     unset: every level
// The last LogDeinit closes the log; a later LogInit reads both again.
//
// Threads: any thread calls any export. A line is formatted on the calling
// thread; the sink lock covers opening, closing and the one write of each
// line, so lines never interleave and each leaves the process before
// LogWrite returns (a crash loses nothing already written).
#include <windows.h>

#include <atomic>
#include <cerrno>
#include <cstdarg>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cwchar>
#include <string>
#include <vector>

namespace {

constexpr std::uint32_t all_levels = 0xFFFFFFFFu;
constexpr std::uint32_t warning_level = 8;
constexpr int max_indent = 40;  // deeper nesting is counted but not drawn

// Open log. Guarded by g_lock; g_configured and g_max_level are also read
// without it on the way in.
SRWLOCK g_lock = SRWLOCK_INIT;
HANDLE g_out = nullptr;  // file or standard error; null: lines go nowhere
bool g_owns_out = false;
int g_init_count = 0;
bool g_detached = false;  // the library is being unloaded: write nothing more
std::atomic<bool> g_configured{false};
std::atomic<std::uint32_t> g_max_level{all_levels};

// Per-thread depth, stored as the TLS slot's value.
DWORD g_depth_slot = TLS_OUT_OF_INDEXES;

class exclusive_lock {
 public:
  exclusive_lock() { ::AcquireSRWLockExclusive(&g_lock); }
  ~exclusive_lock() { ::ReleaseSRWLockExclusive(&g_lock); }
  exclusive_lock(const exclusive_lock&) = delete;
  exclusive_lock& operator=(const exclusive_lock&) = delete;
};

std::wstring environment(const wchar_t* name, bool* present) {
  std::wstring value(64, L'\0');
  for (;;) {
    ::SetLastError(ERROR_SUCCESS);  // an empty variable also gives 0
    const DWORD n = ::GetEnvironmentVariableW(name, &value[0], static_cast<DWORD>(value.size()));
    if (n == 0) {
      const DWORD err = ::GetLastError();
      *present = err != ERROR_ENVVAR_NOT_FOUND;
      return std::wstring();
    }
    if (n < value.size()) {
      value.resize(n);
      *present = true;
      return value;
    }
    value.resize(n);  // n counts the terminator when the buffer was short
  }
}

std::wstring lower_trimmed(const std::wstring& text) {
  std::size_t begin = 0;
  std::size_t end = text.size();
  while (begin < end && (text[begin] == L' ' || text[begin] == L'\t')) ++begin;
  while (end > begin && (text[end - 1] == L' ' || text[end - 1] == L'\t')) --end;
  std::wstring out = text.substr(begin, end - begin);
  for (wchar_t& c : out) {
    if (c >= L'A' && c <= L'Z') c = static_cast<wchar_t>(c - L'A' + L'a');
  }
  return out;
}

// A level number (decimal or 0x hexadecimal) or name; false when neither.
bool parse_level(const std::wstring& setting, std::uint32_t* level) {
  const std::wstring text = lower_trimmed(setting);
  static const struct {
    const wchar_t* name;
    std::uint32_t level;
  } names[] = {
      {L"all", all_levels}, {L"off", 0},     {L"none", 0},     {L"fatal", 1},
      {L"critical", 2},     {L"crit", 2},    {L"error", 4},    {L"err", 4},
      {L"warning", 8},      {L"warn", 8},    {L"info", 16},    {L"trace", 32},
  };
  for (const auto& entry : names) {
    if (text == entry.name) {
      *level = entry.level;
      return true;
    }
  }
  if (text.empty() || text[0] == L'-' || text[0] == L'+') return false;
  wchar_t* end = nullptr;
  errno = 0;
  const unsigned long long value = std::wcstoull(text.c_str(), &end, 0);
  if (end == nullptr || *end != L'\0' || errno != 0 || value > all_levels) return false;
  *level = static_cast<std::uint32_t>(value);
  return true;
}

std::wstring exe_stem() {
  std::wstring path(MAX_PATH, L'\0');
  for (;;) {
    const DWORD n = ::GetModuleFileNameW(nullptr, &path[0], static_cast<DWORD>(path.size()));
    if (n == 0) return L"process";
    if (n < path.size()) {
      path.resize(n);
      break;
    }
    path.resize(path.size() * 2);
  }
  const std::size_t slash = path.find_last_of(L"\\/");
  std::wstring name = slash == std::wstring::npos ? path : path.substr(slash + 1);
  const std::size_t dot = name.rfind(L'.');
  if (dot != std::wstring::npos && dot > 0) name.resize(dot);
  return name;
}

// %TEMP%\scribo\<exe name>-<pid>.log, creating the folder; empty when the
// temporary folder is unknown.
std::wstring default_log_path() {
  wchar_t temp[MAX_PATH + 2] = {};
  const DWORD n = ::GetTempPathW(MAX_PATH + 1, temp);
  if (n == 0 || n > MAX_PATH + 1) return std::wstring();
  std::wstring folder(temp, n);
  if (folder.back() != L'\\') folder += L'\\';
  folder += L"scribo";
  if (!::CreateDirectoryW(folder.c_str(), nullptr)) {
    const DWORD err = ::GetLastError();
    if (err != ERROR_ALREADY_EXISTS) return std::wstring();
  }
  return folder + L'\\' + exe_stem() + L'-' + std::to_wstring(::GetCurrentProcessId()) + L".log";
}

void append_number(std::wstring& out, unsigned long value, int width) {
  wchar_t digits[16];
  int n = 0;
  do {
    digits[n++] = static_cast<wchar_t>(L'0' + value % 10);
    value /= 10;
  } while (value != 0 && n < 16);
  for (int i = n; i < width; ++i) out += L'0';
  while (n > 0) out += digits[--n];
}

// The level's name, padded to five characters; other values as L<number>.
void append_level(std::wstring& out, const std::uint32_t* level) {
  const std::size_t start = out.size();
  if (level == nullptr) {
    out += L'?';
  } else {
    switch (*level) {
      case 1: out += L"FATAL"; break;
      case 2: out += L"CRIT"; break;
      case 4: out += L"ERROR"; break;
      case 8: out += L"WARN"; break;
      case 16: out += L"INFO"; break;
      case 32: out += L"TRACE"; break;
      default:
        out += L'L';
        append_number(out, *level, 0);
        break;
    }
  }
  while (out.size() - start < 5) out += L' ';
}

// The whole line, without its line break. Line breaks and other control
// characters inside the text become blanks, and those at its end are
// dropped, so that one call stays one line.
std::wstring build_line(const std::uint32_t* level, int depth, const wchar_t* function,
                        const std::wstring& text) {
  SYSTEMTIME now{};
  ::GetLocalTime(&now);
  std::wstring line;
  line.reserve(48 + 2 * static_cast<std::size_t>(depth) + text.size() +
               (function != nullptr ? std::wcslen(function) : 0));
  append_number(line, now.wYear, 4);
  line += L'-';
  append_number(line, now.wMonth, 2);
  line += L'-';
  append_number(line, now.wDay, 2);
  line += L' ';
  append_number(line, now.wHour, 2);
  line += L':';
  append_number(line, now.wMinute, 2);
  line += L':';
  append_number(line, now.wSecond, 2);
  line += L'.';
  append_number(line, now.wMilliseconds, 3);
  line += L" [";
  append_number(line, ::GetCurrentProcessId(), 0);
  line += L':';
  append_number(line, ::GetCurrentThreadId(), 0);
  line += L"] ";
  append_level(line, level);
  line += L' ';
  line.append(2 * static_cast<std::size_t>(depth < max_indent ? depth : max_indent), L' ');
  if (function != nullptr && *function != L'\0') {
    line += function;
    line += L": ";
  }
  std::size_t end = text.size();
  while (end > 0 && (text[end - 1] == L'\r' || text[end - 1] == L'\n')) --end;
  for (std::size_t i = 0; i < end; ++i) {
    const wchar_t c = text[i];
    line += (c < 0x20 && c != L'\t') ? L' ' : c;
  }
  return line;
}

// UTF-8 of a UTF-16 text; an unpaired surrogate becomes U+FFFD.
std::string to_utf8(const std::wstring& text) {
  std::string out;
  out.reserve(text.size() + text.size() / 2 + 2);
  for (std::size_t i = 0; i < text.size(); ++i) {
    std::uint32_t c = static_cast<std::uint16_t>(text[i]);
    if (c >= 0xD800 && c <= 0xDBFF && i + 1 < text.size()) {
      const std::uint32_t low = static_cast<std::uint16_t>(text[i + 1]);
      if (low >= 0xDC00 && low <= 0xDFFF) {
        c = 0x10000 + ((c - 0xD800) << 10) + (low - 0xDC00);
        ++i;
      }
    }
    if (c >= 0xD800 && c <= 0xDFFF) c = 0xFFFD;
    if (c < 0x80) {
      out += static_cast<char>(c);
    } else if (c < 0x800) {
      out += static_cast<char>(0xC0 | (c >> 6));
      out += static_cast<char>(0x80 | (c & 0x3F));
    } else if (c < 0x10000) {
      out += static_cast<char>(0xE0 | (c >> 12));
      out += static_cast<char>(0x80 | ((c >> 6) & 0x3F));
      out += static_cast<char>(0x80 | (c & 0x3F));
    } else {
      out += static_cast<char>(0xF0 | (c >> 18));
      out += static_cast<char>(0x80 | ((c >> 12) & 0x3F));
      out += static_cast<char>(0x80 | ((c >> 6) & 0x3F));
      out += static_cast<char>(0x80 | (c & 0x3F));
    }
  }
  return out;
}

void write_all_locked(const std::string& bytes) {
  if (g_out == nullptr || g_out == INVALID_HANDLE_VALUE) return;
  const char* p = bytes.data();
  std::size_t left = bytes.size();
  while (left > 0) {
    const DWORD chunk = left > 0x10000000u ? 0x10000000u : static_cast<DWORD>(left);
    DWORD written = 0;
    if (!::WriteFile(g_out, p, chunk, &written, nullptr) || written == 0) return;
    p += written;
    left -= written;
  }
}

void write_line_locked(const std::uint32_t* level, int depth, const wchar_t* function,
                       const std::wstring& text) {
  write_all_locked(to_utf8(build_line(level, depth, function, text) + L"\r\n"));
}

void close_locked() {
  if (g_owns_out && g_out != nullptr && g_out != INVALID_HANDLE_VALUE) ::CloseHandle(g_out);
  g_out = nullptr;
  g_owns_out = false;
  g_configured = false;
}

// Reads the settings and opens the log. Problems with the settings are
// written into the log itself, whatever the level filter.
void open_locked() {
  close_locked();
  std::vector<std::wstring> notes;

  bool level_set = false;
  const std::wstring level_setting = environment(L"SCRIBO_LOG_LEVEL", &level_set);
  std::uint32_t max_level = all_levels;
  if (level_set && !parse_level(level_setting, &max_level)) {
    max_level = all_levels;
    notes.push_back(L"SCRIBO_LOG_LEVEL \"" + level_setting +
                    L"\" is neither a level number nor a level name; writing every level");
  }

  bool file_set = false;
  std::wstring path = environment(L"SCRIBO_LOG_FILE", &file_set);
  if (!file_set || path.empty()) path = default_log_path();
  if (path == L"-") {
    g_out = ::GetStdHandle(STD_ERROR_HANDLE);
  } else if (path.empty()) {
    g_out = ::GetStdHandle(STD_ERROR_HANDLE);
    notes.push_back(L"no temporary folder for the log file; writing to standard error");
  } else {
    // Append-only access: every write lands at the current end of the file,
    // even with other handles or processes appending to it.
    HANDLE file = ::CreateFileW(path.c_str(), FILE_APPEND_DATA | SYNCHRONIZE,
                                FILE_SHARE_READ | FILE_SHARE_WRITE | FILE_SHARE_DELETE,
                                /* security */ nullptr, OPEN_ALWAYS, FILE_ATTRIBUTE_NORMAL,
                                /* template */ nullptr);
    const DWORD err = ::GetLastError();
    if (file == INVALID_HANDLE_VALUE) {
      g_out = ::GetStdHandle(STD_ERROR_HANDLE);
      notes.push_back(L"cannot open log file \"" + path + L"\" err=" + std::to_wstring(err) +
                      L"; writing to standard error");
    } else {
      g_out = file;
      g_owns_out = true;
    }
  }
  g_max_level = max_level;
  g_configured = true;
  for (const auto& note : notes) write_line_locked(&warning_level, 0, L"scribo", note);
}

// Opens the log on the first line written without a LogInit.
void ensure_open() {
  if (g_configured) return;
  exclusive_lock lock;
  if (!g_configured && !g_detached) open_locked();
}

bool level_written(const std::uint32_t* level) {
  const std::uint32_t max_level = g_max_level;
  if (level == nullptr) return max_level != 0;
  return *level <= max_level;
}

// The calling thread's depth before this line, after applying `step` the way
// the line wants it: an exit line is drawn one level out, an entry line at
// the level it opens from.
int take_depth(std::int16_t step) {
  if (g_depth_slot == TLS_OUT_OF_INDEXES) return 0;
  long depth = static_cast<long>(reinterpret_cast<std::intptr_t>(::TlsGetValue(g_depth_slot)));
  long drawn = depth;
  if (step < 0) {
    depth += step;
    if (depth < 0) depth = 0;
    drawn = depth;
  } else if (step > 0) {
    depth += step;
  }
  ::TlsSetValue(g_depth_slot, reinterpret_cast<void*>(static_cast<std::intptr_t>(depth)));
  return static_cast<int>(drawn);
}

// The text of a printf-style format. A format the runtime refuses is shown
// as it stands rather than dropped.
std::wstring format_text(const wchar_t* format, va_list args) {
  if (format == nullptr) return std::wstring();
  va_list probe;
  va_copy(probe, args);
  const int length = ::_vscwprintf(format, probe);
  va_end(probe);
  if (length < 0) return format;
  std::wstring text(static_cast<std::size_t>(length) + 1, L'\0');
  va_list copy;
  va_copy(copy, args);
  // The Microsoft function, not the C99 vswprintf: %s is a wide string here.
  const int written = ::_vsnwprintf(&text[0], text.size(), format, copy);
  va_end(copy);
  text.resize(written < 0 ? 0 : (written < length ? written : length));
  return text;
}

}  // namespace

extern "C" {

void LogInit() {
  exclusive_lock lock;
  if (g_detached) return;
  try {
    if (g_init_count++ == 0 || !g_configured) open_locked();
  } catch (...) {
    // Out of memory while opening: the first line written tries again.
  }
}

void LogDeinit() {
  exclusive_lock lock;
  if (g_init_count > 0) --g_init_count;
  if (g_init_count == 0) close_locked();
}

// No metrics are gathered.
void LogUninitMetrics() {}

// Modules are not registered by this library; nothing to forget.
void LogRemoveModule(const char* /*who*/) {}

std::int32_t LogWrite(std::int16_t depth_step, const std::uint32_t* level, HMODULE /*module*/,
                      const wchar_t* function, const wchar_t* format, ...) {
  // Callers log a failure before they are done with its last error.
  const DWORD last_error = ::GetLastError();
  std::int32_t result = 0;
  va_list args;
  va_start(args, format);
  try {
    ensure_open();
    const int depth = take_depth(depth_step);
    if (level_written(level)) {
      const std::wstring text = format_text(format, args);
      const std::string bytes = to_utf8(build_line(level, depth, function, text) + L"\r\n");
      exclusive_lock lock;
      write_all_locked(bytes);
    }
  } catch (...) {
    // Out of memory for the line: it is lost, and nothing is thrown into a
    // caller that may not be built to catch it.
    result = static_cast<std::int32_t>(E_OUTOFMEMORY);
  }
  va_end(args);
  ::SetLastError(last_error);
  return result;
}

}  // extern "C"

BOOL WINAPI DllMain(HINSTANCE /*module*/, DWORD reason, LPVOID /*reserved*/) {
  switch (reason) {
    case DLL_PROCESS_ATTACH:
      g_depth_slot = ::TlsAlloc();
      break;
    case DLL_PROCESS_DETACH: {
      // Lines that still arrive (from a component detached after this
      // library) are dropped instead of reopening the log.
      exclusive_lock lock;
      close_locked();
      g_detached = true;
      g_configured = true;
      if (g_depth_slot != TLS_OUT_OF_INDEXES) ::TlsFree(g_depth_slot);
      g_depth_slot = TLS_OUT_OF_INDEXES;
      break;
    }
    default:
      break;
  }
  return TRUE;
}
