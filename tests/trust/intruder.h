// An intruder: the pipe client of tests/faults/hostile_peer.cpp, built
// signed like us, signed by another signer and unsigned (../trust_peers/),
// which writes whatever bytes the test builds, and can rewrite its loader
// data or swap its running image for another file. With the message
// builders the trust tests hand it.
#pragma once

#include <string>
#include <vector>

#include "bus/comm/listeners_codec.h"
#include "e2e/host_process.h"
#include "frame_codec.h"
#include "message_codec.h"

namespace trust_test {

using bytes = std::vector<unsigned char>;
using namespace std::chrono_literals;

inline bytes operator+(bytes a, const bytes& b) {
  a.insert(a.end(), b.begin(), b.end());
  return a;
}

// The client's hello for bus "main", joining "alerts" and the service channel.
inline bytes hello() {
  bytes out;
  parlo::ipc::frame::encode_hello(parlo::ipc::frame::hello{parlo::ipc::frame::protocol_version, "main",
                                                           {"alerts", "vorbel_service"}},
                                  out);
  return out;
}

// A listeners message claiming `pid`, with `count` listeners of "alerts"
// named prefix0, prefix1, ..., as a frame on "vorbel_service"; with
// `claimed_origin`, it also carries the IPC library's origin blob naming that
// pid, as a sender may try.
inline bytes listeners(std::uint32_t pid, std::size_t count, const std::string& prefix,
                       std::uint32_t claimed_origin = 0) {
  listener_list list;
  for (std::size_t i = 0; i < count; ++i) list.push_back(listener{"alerts", prefix + std::to_string(i)});
  parlo::codec::message_content content{2, {{"params", comm::encode_listeners(pid, list)}}};
  if (claimed_origin != 0) {
    const auto* o = reinterpret_cast<const unsigned char*>(&claimed_origin);  // little-endian, as the library writes it
    content.fields.push_back({"parlo_ipc.origin_pid", {o[0], o[1], o[2], o[3]}});
  }
  bytes wire, frame;
  parlo::codec::encode(content, wire);
  parlo::ipc::frame::encode_message("vorbel_service", wire.data(), wire.size(), frame);
  return frame;
}

// The IPC library's verdict on a client of ours, by its pid: "admitted",
// "refused", or empty when none came in time.
inline std::string verdict(DWORD pid) {
  std::string seen;
  test_support::wait_until([&] {
    const std::wstring at = L" pid=" + std::to_wstring(pid) + L" ";
    if (test_support::has_line(L"parlo_ipc::pipe_server::serve", at + L"admitted")) seen = "admitted";
    if (test_support::has_line(L"parlo_ipc::pipe_server::serve", at + L"refused")) seen = "refused";
    return !seen.empty();
  }, 20s);
  return seen;
}

inline std::string full_path(const std::string& relative) {
  char full[MAX_PATH];
  return std::string(full, ::GetFullPathNameA(relative.c_str(), MAX_PATH, full, nullptr));
}

// An intruder process aimed at `pipe`; `image` is intruder_a, intruder_b or
// intruder_unsigned, or a full path. run() sends one command and returns its
// answer: "ok ..." or "failed err=N".
class intruder : public e2e::host_process {
 public:
  intruder(const std::string& image, const std::string& name, const std::string& pipe)
      : host_process(image.find('\\') == std::string::npos ? "..\\trust_peers\\" + image + ".exe" : image,
                     e2e::write_file(name + ".pipe", pipe), name),
        name_(name) {}

  std::string run(const std::string& command) {
    const std::string tag = "#" + std::to_string(++sequence_) + " ";
    send(command);
    const std::string answer = wait_line(tag, 60s);
    return answer.empty() ? "timed out: " + command : answer.substr(tag.size());
  }
  std::string write(const bytes& data) {
    return run("send " + e2e::write_file(name_ + ".bin", std::string(data.begin(), data.end())));
  }

 private:
  const std::string name_;
  int sequence_ = 0;
};

}  // namespace trust_test
