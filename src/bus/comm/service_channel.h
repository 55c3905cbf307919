// The service channel "vorbel_service": the buses of different processes tell
// each other their listeners on it.
//
// One per bus, owned by the bus. The messaging library runs on_message on its
// delivery threads between listen and the end of the subscription; the
// service channel takes no lock of its own: it reads only `observer_` and
// `own_pid_`, fixed while the subscription lives, and hands everything else
// to the bus. export_channel and import_channel run only under the bus
// registry's mutex, through the gateway.
#pragma once

#include <cstddef>
#include <cstdint>
#include <memory>
#include <set>
#include <string>

#include "bus/listener.h"
#include "bus/parlo/parlo.h"
#include "gateway/parlo_ipc/parlo_ipc.h"

struct ibus;

namespace comm {

constexpr const char* service_channel_name = "vorbel_service";
// The blob of a listeners message, and the largest message it can hold: the
// messaging library carries at most parlo::max_message_size bytes of blobs
// in one message, their names included, and the receiving IPC library adds
// the origin blob (4 bytes under its name) to every message from a pipe.
constexpr const char* listeners_blob_name = "params";
constexpr std::uint64_t max_listeners_message_size =
    parlo::max_message_size - std::char_traits<char>::length(listeners_blob_name) -
    (std::char_traits<char>::length(parlo::ipc::origin_pid_blob) + 4);

// Most listeners taken from one process: a larger list is refused with a
// line (the connection stays, and the process's earlier list with it), so
// that a peer cannot make this process hold more than this many of its
// listeners. At about a hundred bytes per listener held, some 7 MiB per
// peer at most; well above the tens of thousands a host registers in a
// burst. A bus registers no more than this itself: its peers would refuse
// its table.
constexpr std::size_t max_listeners_per_process = 65536;

enum class service_channel_messages_id : std::uint32_t {
  publish_listeners = 1,  // no content: asks every receiver to publish
  listeners = 2,          // blob "params": the listeners message
};

// What the bus does with what arrives on the service channel.
struct iservice_channel_observer {
  // A process asked for this process's listeners.
  virtual std::uint32_t on_listeners_requested() = 0;
  // A process published its listeners; the list is the observer's.
  // `origin` is `pid` when the IPC library delivered the list from that
  // process's connection (which it had admitted), 0 when nobody said where
  // it came from.
  virtual void on_remote_listeners(const std::uint32_t& pid, listener_list listeners, std::uint32_t origin) = 0;

 protected:
  ~iservice_channel_observer() = default;
};

class service_channel {
 public:
  service_channel(ibus* bus, parlo::channel* channel);
  service_channel(const service_channel&) = delete;
  service_channel& operator=(const service_channel&) = delete;
  // Ends the subscription first, so no callback reaches a destroyed object.
  ~service_channel();

  // Subscribes and starts delivering to `observer`. Failures are logged; the
  // channel then receives nothing.
  void subscribe(iservice_channel_observer* observer);

  // Carries the service channel over `pipe` too (once per pipe).
  std::uint32_t export_channel(parlo::ipc::gateway* ipc, const char* pipe);
  std::uint32_t import_channel(parlo::ipc::gateway* ipc, const char* bus_name, const char* pipe);

  // Posts an encoded listeners message (listeners_codec.h) as message id 2.
  // 0, or the messaging library's refusal of the blob or of the post,
  // logged; nothing is posted without its blob.
  std::uint32_t publish_listeners(const std::uint8_t* bytes, std::size_t size);
  // Asks every process on the channel to publish its listeners.
  std::uint32_t request_remote_listeners();

  // A listeners message is taken only under the pid of the process it came
  // from, when the messaging library says which (the IPC library's origin
  // blob); one whose pid differs, or over max_listeners_per_process, is
  // refused with a warning.
  void on_message(parlo::message* message);

  bool subscribed() const { return subscription_ != nullptr; }

 private:
  void release_subscription();
  parlo::message* new_message(const wchar_t* function, service_channel_messages_id id);

  ibus* bus_;
  parlo::channel* channel_;
  iservice_channel_observer* observer_ = nullptr;
  std::uint32_t own_pid_;
  parlo::subscription* subscription_ = nullptr;
  std::set<std::string> exported_pipes_;
  std::set<std::string> imported_pipes_;
};

// Creates "vorbel_service" on the bus's messaging bus; null (logged) when the
// library refuses.
std::unique_ptr<service_channel> make_service_channel(ibus* bus);

}  // namespace comm
