// The binding when scribo.dll is missing or lacks LogWrite. No scribo.dll lies
// beside this program; a copy without LogWrite waits in nowrite\.
#include <gtest/gtest.h>

#include <windows.h>

#include <string>

#include "logging/log_dll.h"
#include "logging/logger.h"

TEST(fallback, a_missing_library_or_one_without_logwrite_gives_a_writer_that_drops_every_line) {
  std::wstring nowrite_path(MAX_PATH, L'\0');
  nowrite_path.resize(::GetModuleFileNameW(nullptr, &nowrite_path[0], MAX_PATH));
  nowrite_path = nowrite_path.substr(0, nowrite_path.rfind(L'\\')) + L"\\nowrite\\scribo.dll";
  for (const bool loaded : {false, true}) {
    HMODULE nowrite = loaded ? ::LoadLibraryW(nowrite_path.c_str()) : nullptr;
    ASSERT_EQ(loaded, nowrite != nullptr);
    logging::process_attach();
    logging::CLogDLL* log = logging::current_instance();
    ASSERT_NE(nullptr, log);
    EXPECT_EQ(nowrite, log->module);
    EXPECT_EQ(&logging::noop_log_write, log->LogWrite);
    { logging::trace_scope trace(L"quiet_operation"); }
    logging::logger_stream(logging::level_error, L"quiet") << L"nowhere " << 5;
    logging::process_detach(/* process_terminating */ false);
    EXPECT_EQ(0, logging::reference_count());
    EXPECT_EQ(nowrite, ::GetModuleHandleW(L"scribo.dll")) << "the binding gave back more or less than it took";
    if (nowrite != nullptr) ::FreeLibrary(nowrite);
  }
}
