// The gateway of one bus: a thin owner of the IPC library's gateway object.
//
// Built, configured, started, stopped and destroyed by the registry under
// its mutex, so its own operations never overlap and it takes no lock. The
// IPC library's threads never touch it: they call the gateway observer,
// which reaches this object's observer list only from its own task pool.
// The observer list is the one piece of state shared between threads; it
// has its own reader/writer lock. The trust explainer face may be called from
// any host thread while the gateway exists; it reads only what is fixed
// before the IPC library starts.
#pragma once

#include <vorbel/igateway.h>
#include <vorbel/igateway_admission.h>

#include <cstdint>
#include <map>
#include <memory>
#include <string>

#include "gateway/gateway_observer.h"
#include "gateway/parlo_ipc/parlo_ipc.h"
#include "platform/handles.h"
#include "platform/observable.h"

class bus;

// Its primary face is igateway; igateway_trust_explainer is a second face,
// reached through GetInterface.
class gateway final : public qm::observable<igateway_observer_base*, igateway>, public igateway_trust_explainer {
 public:
  // Loads parlo_ipc.dll from this component's folder and creates the
  // library's gateway over `owner`'s messaging bus. Throws std::system_error
  // when it cannot; everything built so far is undone.
  explicit gateway(bus* owner);
  gateway(const gateway&) = delete;
  gateway& operator=(const gateway&) = delete;
  ~gateway();

  void* GetInterface(GUID iid) override;

  std::uint32_t explain_process(std::uint32_t pid, std::uint32_t level,
                                igateway_admission_observer* receiver) override;
  std::uint32_t explain_image(const char* path, std::uint32_t level, igateway_admission_observer* receiver) override;

  // Each also carries the bus's service channel over the same pipe. `security`
  // is the pipe's admission level (0: same signer only, 1: any valid signer),
  // for the clients of an exported pipe and the server of an imported one;
  // any other level is refused with 87 and a line, and nothing is set up.
  std::uint32_t export_channel(const char* channel_name, const char* pipe_name,
                               std::uint32_t link_type, std::uint32_t security);
  std::uint32_t import_channel(const char* remote_bus_name, const char* channel_name,
                               const char* pipe_name, const char* remote_channel_name,
                               std::uint32_t link_type, std::uint32_t security);
  // 0 on success; then the bus hears of connections.
  std::uint32_t start();
  std::uint32_t stop();

  // Every pipe given to an export or import, with its latest level.
  const std::map<std::string, std::uint32_t>& pipes() const { return pipes_; }
  gateway_observer& events() { return *observer_; }

 private:
  struct library_record {
    winapi::unique_module module;
    parlo::ipc::create_gateway_fn create_gateway;
    parlo::ipc::destroy_gateway_fn destroy_gateway;
  };

  bus* bus_;
  std::unique_ptr<gateway_observer> observer_;
  std::unique_ptr<library_record> library_;
  parlo::ipc::gateway* ipc_ = nullptr;
  std::map<std::string, std::uint32_t> pipes_;
};
