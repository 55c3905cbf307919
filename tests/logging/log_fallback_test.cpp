// The binding when scribo.dll is missing or lacks LogWrite. No scribo.dll lies
// beside this program; a copy without LogWrite waits in nowrite\ for the test
// that loads it as a host would.
#include <gtest/gtest.h>

#include <windows.h>

#include <string>

#include "logging/log_dll.h"
#include "logging/logger.h"
#include "support/log_capture.h"

namespace {

constexpr std::int32_t e_nointerface = static_cast<std::int32_t>(0x80004002u);

std::wstring program_dir() {
  std::wstring path(MAX_PATH, L'\0');
  path.resize(::GetModuleFileNameW(nullptr, &path[0], MAX_PATH));
  return path.substr(0, path.rfind(L'\\'));
}

class fallback : public ::testing::Test {
 protected:
  void TearDown() override {
    EXPECT_EQ(0, logging::reference_count());
    EXPECT_EQ(nullptr, logging::current_instance());
    EXPECT_EQ(nullptr, ::GetModuleHandleW(L"scribo.dll"));
  }
};

TEST_F(fallback, a_missing_library_gives_a_writer_that_drops_every_line) {
  logging::process_attach();
  logging::CLogDLL* log = logging::current_instance();
  ASSERT_NE(nullptr, log);
  EXPECT_EQ(nullptr, log->module);
  EXPECT_EQ(&logging::noop_log_write, log->LogWrite);
  EXPECT_EQ(nullptr, log->LogUninitMetrics);
  EXPECT_EQ(nullptr, log->LogRemoveModule);
  const std::uint32_t level = logging::level_info;
  EXPECT_EQ(e_nointerface,
            log->LogWrite(0, &level, ::GetModuleHandleW(nullptr), L"f", L"%s", L"text"));

  // Every producer goes on as if the lines were written.
  { logging::trace_scope trace(L"quiet_operation"); }
  logging::logger_stream(logging::level_error, L"quiet") << L"nowhere " << 5;
  EXPECT_EQ(1, logging::reference_count());
  EXPECT_EQ(nullptr, ::GetModuleHandleW(L"scribo.dll"));
  logging::process_detach(/* process_terminating */ false);
}

TEST_F(fallback, a_library_without_logwrite_is_initialised_and_lines_dropped) {
  HMODULE nowrite = ::LoadLibraryW((program_dir() + L"\\nowrite\\scribo.dll").c_str());
  ASSERT_NE(nullptr, nowrite);
  logging::process_attach();
  logging::CLogDLL* log = logging::current_instance();
  ASSERT_NE(nullptr, log);
  EXPECT_EQ(nowrite, log->module);
  EXPECT_EQ(&logging::noop_log_write, log->LogWrite);
  EXPECT_NE(nullptr, log->LogSetLevel) << "the other exports are still resolved";
  EXPECT_NE(nullptr, log->LogGetLevel);
  EXPECT_EQ(nullptr, log->LogEnable);
  EXPECT_EQ(L"LogInit", test_support::log_events());

  { logging::trace_scope trace(L"quiet_operation"); }
  logging::logger_stream(logging::level_error, L"quiet") << L"nowhere";
  EXPECT_EQ(L"LogInit", test_support::log_events());

  logging::process_detach(/* process_terminating */ false);
  EXPECT_EQ(L"LogInit,LogDeinit,LogUninitMetrics,LogRemoveModule", test_support::log_events());
  EXPECT_EQ(nowrite, ::GetModuleHandleW(L"scribo.dll")) << "the binding gave back more than it took";
  ::FreeLibrary(nowrite);
}

}  // namespace
