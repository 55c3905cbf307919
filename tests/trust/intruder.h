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
// named prefix0, prefix1, ..., as a frame on "vorbel_service".
inline bytes listeners(std::uint32_t pid, std::size_t count, const std::string& prefix) {
  listener_list list;
  for (std::size_t i = 0; i < count; ++i) list.push_back(listener{"alerts", prefix + std::to_string(i)});
  parlo::codec::message_content content{2, {{"params", comm::encode_listeners(pid, list)}}};
  bytes wire, frame;
  parlo::codec::encode(content, wire);
  parlo::ipc::frame::encode_message("vorbel_service", wire.data(), wire.size(), frame);
  return frame;
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
