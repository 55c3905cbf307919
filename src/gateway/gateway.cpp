#include "gateway/gateway.h"

#include "bus/bus.h"
#include "logging/logger.h"
#include "platform/win_api.h"

using logging::level_critical;
using logging::level_error;
using logging::level_info;
using logging::level_warning;
using logging::logger_stream;

namespace {

struct ipc_library {
  winapi::unique_module module;
  parlo::ipc::create_gateway_fn create_gateway;
  parlo::ipc::destroy_gateway_fn destroy_gateway;
  parlo::ipc::gateway* ipc;
};

ipc_library make_ipc_gateway(parlo::bus* messaging_bus, parlo::ipc::gateway::events* sink) {
  const std::wstring path = winapi::module_directory(winapi::current_module()) + L"parlo_ipc.dll";
  ipc_library library;
  library.module = winapi::load_library(path.c_str());
  library.create_gateway = winapi::get_proc_address_as<parlo::ipc::create_gateway_fn>(
      library.module.get(), "create_gateway");
  library.destroy_gateway = winapi::get_proc_address_as<parlo::ipc::destroy_gateway_fn>(
      library.module.get(), "destroy_gateway");
  library.ipc = library.create_gateway(messaging_bus, sink);
  if (library.ipc == nullptr) {
    logger_stream(level_critical, L"make_ipc_gateway") << L"create_gateway fail";
    library.module.reset();
    winapi::throw_win_error(winapi::gen_failure, "create_gateway failed");
  }
  return library;
}

}  // namespace

gateway::gateway(bus* owner)
    : bus_(owner), observer_(std::make_unique<gateway_observer>(&observer_list())) {
  ipc_library made = make_ipc_gateway(static_cast<parlo::bus*>(bus_->get_messaging_bus()),
                                      observer_.get());
  library_ = std::make_unique<library_record>(
      library_record{std::move(made.module), made.create_gateway, made.destroy_gateway});
  ipc_ = made.ipc;
}

gateway::~gateway() {
  pipes_.clear();
  // The library's gateway goes before the library and before the event sink,
  // so no library thread can call a destroyed sink.
  if (ipc_ != nullptr && library_) library_->destroy_gateway(ipc_);
  ipc_ = nullptr;
  library_.reset();
  observer_.reset();
}

void* gateway::GetInterface(GUID iid) {
  if (qm::same_iid(iid, IID_IQmBaseInterface) || qm::same_iid(iid, IID_igateway_base) ||
      qm::same_iid(iid, IID_igateway)) {
    return static_cast<igateway*>(this);
  }
  if (qm::same_iid(iid, IID_igateway_trust_explainer)) return static_cast<igateway_trust_explainer*>(this);
  const qm::iid_halves h = qm::split_iid(iid);
  logger_stream(level_warning, L"gateway::GetInterface")
      << L"unknown interface " << static_cast<unsigned long long>(h.first + h.last);
  return nullptr;
}

std::uint32_t gateway::explain_process(std::uint32_t pid, std::uint32_t level,
                                       igateway_admission_observer* receiver) try {
  if (receiver == nullptr || level > max_pipe_security_level) {
    logger_stream(level_error, L"gateway::explain_process")
        << L"refused: receiver=" << static_cast<void*>(receiver) << L" level=" << level
        << L" (a receiver and a pipe security level, 0 or 1, are needed)";
    return ERROR_INVALID_PARAMETER;
  }
  const admission_record record(observer_->explain_process(pid, level));
  receiver->on_admission(&record.view());
  return 0;
} catch (...) {
  logging::log_current_exception(L"gateway::explain_process");
  return ERROR_OUTOFMEMORY;
}

std::uint32_t gateway::explain_image(const char* path, std::uint32_t level,
                                     igateway_admission_observer* receiver) try {
  std::error_code code;
  const std::wstring wide = path != nullptr ? winapi::utf8_to_utf16(path, code) : std::wstring();
  if (receiver == nullptr || level > max_pipe_security_level || wide.empty()) {
    logger_stream(level_error, L"gateway::explain_image")
        << L"refused: receiver=" << static_cast<void*>(receiver) << L" level=" << level
        << L" path=" << (path == nullptr ? L"nullptr" : (wide.empty() ? L"empty or not UTF-8" : L"given"))
        << L" (a receiver, a path and a pipe security level, 0 or 1, are needed)";
    return ERROR_INVALID_PARAMETER;
  }
  const admission_record record(observer_->explain_image(wide, level));
  receiver->on_admission(&record.view());
  return 0;
} catch (...) {
  logging::log_current_exception(L"gateway::explain_image");
  return ERROR_OUTOFMEMORY;
}

std::uint32_t gateway::export_channel(const char* channel_name, const char* pipe_name,
                                      std::uint32_t link_type, std::uint32_t security) {
  logging::trace_scope trace(L"gateway::export_channel");
  if (channel_name == nullptr || pipe_name == nullptr) {
    logger_stream(level_error, L"gateway::export_channel") << L"bus_name or channel or pipe is nullptr";
    return ERROR_INVALID_PARAMETER;
  }
  logger_stream(level_info, L"gateway::export_channel")
      << L"channel=" << channel_name << L" link_type=" << link_type << L" security=" << security;
  if (security > max_pipe_security_level) {
    logger_stream(level_error, L"gateway::export_channel")
        << L"security=" << security << L" is no pipe security level (0 or 1): pipe=" << pipe_name << L" refused";
    return ERROR_INVALID_PARAMETER;
  }
  pipes_[pipe_name] = security;
  const std::uint32_t result = ipc_->export_channel(channel_name, pipe_name, link_type);
  if (result != 0) {
    logger_stream(level_error, L"gateway::export_channel") << L"export_channel err=" << result;
  }
  if (comm::service_channel* service = bus_->get_service_channel()) {
    service->export_channel(ipc_, pipe_name);
  }
  return result;
}

std::uint32_t gateway::import_channel(const char* remote_bus_name, const char* channel_name,
                                      const char* pipe_name, const char* remote_channel_name,
                                      std::uint32_t link_type, std::uint32_t security) {
  logging::trace_scope trace(L"gateway::import_channel");
  if (remote_bus_name == nullptr || channel_name == nullptr || pipe_name == nullptr ||
      remote_channel_name == nullptr) {
    logger_stream(level_error, L"gateway::import_channel") << L"bus_name or channel or pipe is nullptr";
    return ERROR_INVALID_PARAMETER;
  }
  logger_stream(level_info, L"gateway::import_channel")
      << L"bus_name=" << remote_bus_name << L" channel=" << channel_name << L" link_type="
      << link_type << L" security=" << security;
  if (security > max_pipe_security_level) {
    logger_stream(level_error, L"gateway::import_channel")
        << L"security=" << security << L" is no pipe security level (0 or 1): pipe=" << pipe_name << L" refused";
    return ERROR_INVALID_PARAMETER;
  }
  pipes_[pipe_name] = security;
  const std::uint32_t result =
      ipc_->import_channel(channel_name, pipe_name, remote_bus_name, remote_channel_name, link_type);
  if (result != 0) {
    logger_stream(level_error, L"gateway::import_channel") << L"import_channel err=" << result;
  }
  if (comm::service_channel* service = bus_->get_service_channel()) {
    service->import_channel(ipc_, remote_bus_name, pipe_name);
  }
  return result;
}

std::uint32_t gateway::start() {
  logging::trace_scope trace(L"gateway::start");
  observer_->set_pipe_security_map(make_pipe_security_map(pipes_));
  const std::uint32_t result = ipc_->start();
  if (result != 0) {
    logger_stream(level_error, L"gateway::start") << L"start gateway err=" << result;
    return result;
  }
  add_observer(static_cast<igateway_observer*>(bus_), 0);
  return result;
}

std::uint32_t gateway::stop() {
  logging::trace_scope trace(L"gateway::stop");
  // First, so that the bus hears nothing from a stopping gateway.
  remove_observer(static_cast<igateway_observer*>(bus_), 0);
  const std::uint32_t result = ipc_->stop();
  if (result != 0) {
    logger_stream(level_error, L"gateway::stop") << L"stop gateway err=" << result;
  }
  return result;
}
