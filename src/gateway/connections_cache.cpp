#include "gateway/connections_cache.h"

#include "logging/logger.h"
#include "platform/win_api.h"

using logging::level_error;
using logging::level_info;
using logging::logger_stream;

void connections_cache::insert(HANDLE pipe, std::string name, std::uint32_t pid) {
  logger_stream(level_info, L"connections_cache::insert")
      << L"connections_cache::insert pipe=" << pipe << L" name=" << name << L" pid=" << pid;
  entries_.emplace(key(pipe), entry{std::move(name), pid});
}

bool connections_cache::rem(HANDLE pipe) {
  logger_stream(level_info, L"connections_cache::rem") << L"connections_cache::rem pipe=" << pipe;
  return entries_.erase(key(pipe)) != 0;
}

connection_info connections_cache::get(HANDLE pipe) const {
  auto found = entries_.find(key(pipe));
  if (found == entries_.end()) return connection_info{"", 0, 0};
  return connection_info{found->second.name.c_str(), found->second.name.size(), found->second.pid};
}

std::string get_pipe_name(HANDLE pipe) {
  std::error_code code;
  const std::wstring wide = winapi::query_file_name(pipe, code);
  if (wide.empty()) {
    logger_stream(level_info, L"get_pipe_name") << L"failed get pipe name for handle=" << pipe;
    return std::string();
  }
  std::string name = winapi::utf16_to_utf8(wide, code);
  if (code) {
    logger_stream(level_error, L"get_pipe_name")
        << L"utf16_to_utf8(" << wide << L") err=" << code.value();
    return std::string();
  }
  return name;
}
