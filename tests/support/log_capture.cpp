#include "support/log_capture.h"

#include <thread>

namespace test_support {
namespace {

using count_fn = std::size_t (*)();
using read_fn = bool (*)(std::size_t, std::int16_t*, std::uint32_t*, HMODULE*, const wchar_t**,
                         const wchar_t**);
using clear_fn = void (*)();
using events_fn = std::size_t (*)(wchar_t*, std::size_t);

template <typename Fn>
Fn export_of(const char* name) {
  HMODULE scribo = ::GetModuleHandleW(L"scribo.dll");
  if (scribo == nullptr) return nullptr;
  return reinterpret_cast<Fn>(reinterpret_cast<void*>(::GetProcAddress(scribo, name)));
}

}  // namespace

std::vector<log_line> log_lines() {
  std::vector<log_line> lines;
  auto count = export_of<count_fn>("ScriboDoubleCount");
  auto read = export_of<read_fn>("ScriboDoubleRead");
  if (count == nullptr || read == nullptr) return lines;
  const std::size_t n = count();
  for (std::size_t i = 0; i < n; ++i) {
    log_line line{};
    const wchar_t* function = nullptr;
    const wchar_t* text = nullptr;
    if (!read(i, &line.depth, &line.level, &line.module, &function, &text)) break;
    line.function = function;
    line.text = text;
    lines.push_back(std::move(line));
  }
  return lines;
}

std::vector<log_line> find_lines(const std::wstring& function, const std::wstring& part) {
  std::vector<log_line> found;
  for (auto& line : log_lines()) {
    if ((function.empty() || line.function == function) &&
        line.text.find(part) != std::wstring::npos) {
      found.push_back(std::move(line));
    }
  }
  return found;
}

bool has_line(const std::wstring& function, const std::wstring& part) {
  return !find_lines(function, part).empty();
}

void clear_log() {
  if (auto clear = export_of<clear_fn>("ScriboDoubleClear")) clear();
}

std::wstring log_events() {
  auto events = export_of<events_fn>("ScriboDoubleEvents");
  if (events == nullptr) return std::wstring();
  std::wstring text(events(nullptr, 0) + 1, L'\0');
  text.resize(events(text.data(), text.size()));
  return text;
}

bool wait_for_line(const std::wstring& function, const std::wstring& part,
                   std::chrono::milliseconds timeout) {
  return wait_until([&] { return has_line(function, part); }, timeout);
}

bool wait_until(const std::function<bool()>& condition, std::chrono::milliseconds timeout) {
  const auto deadline = std::chrono::steady_clock::now() + timeout;
  for (;;) {
    if (condition()) return true;
    if (std::chrono::steady_clock::now() >= deadline) return false;
    std::this_thread::sleep_for(std::chrono::milliseconds(2));
  }
}

std::wstring dump_log() {
  std::wstring out;
  for (const auto& line : log_lines()) {
    out += std::to_wstring(line.level) + L" " + line.function + L": " + line.text + L"\n";
  }
  return out;
}

}  // namespace test_support
