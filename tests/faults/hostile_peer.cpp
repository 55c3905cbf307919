// A peer that speaks the pipe protocol by hand, so that a serving process can
// be sent what no well-behaved gateway sends: broken frames, malformed and
// oversized listeners messages, a frame cut off half-way. Signed like every
// program of the build, so that it is admitted.
//
//   hostile_peer --config FILE --log FILE --stdin
//
// FILE after --config holds the pipe path (one line); --log is ignored. The
// program prints "ready pid=N", then runs one command per line of standard
// input and answers each with one line ("sent ...", "connected ...", or
// "failed ..."). A reader thread prints what the server sends: "frame
// hello ...", "frame listeners pid=P count=N", "frame request", "frame
// message ...", and "closed err=N" when the pipe ends.
#include <windows.h>

#include <algorithm>
#include <cstdint>
#include <cstdio>
#include <fstream>
#include <iostream>
#include <memory>
#include <mutex>
#include <sstream>
#include <string>
#include <thread>
#include <vector>

#include "bus/comm/listeners_codec.h"
#include "frame_codec.h"
#include "listeners_message_generated.h"
#include "message_codec.h"
#include "platform/srw_sync.h"

namespace {

namespace frame = parlo::ipc::frame;
using bytes = std::vector<unsigned char>;

constexpr const char* service_channel = "vorbel_service";
constexpr DWORD write_timeout_ms = 30000;

srw_mutex g_out_mutex;

void say(const std::string& line) {
  std::lock_guard<srw_mutex> lock(g_out_mutex);
  std::fwrite(line.data(), 1, line.size(), stdout);
  std::fputc('\n', stdout);
  std::fflush(stdout);
}

std::wstring widen(const std::string& text) {
  return std::wstring(text.begin(), text.end());
}

// The parlo wire form of a message with `id` and, when `params` is given, the
// blob "params".
bytes parlo_wire(std::uint32_t id, const bytes* params) {
  parlo::codec::message_content content;
  content.id = id;
  if (params != nullptr) content.fields.push_back({"params", *params});
  bytes wire;
  if (parlo::codec::encode(content, wire) != parlo::codec::status::ok) wire.clear();
  return wire;
}

// A message frame on `channel` carrying `wire` as it is.
bytes message_frame(const std::string& channel, const bytes& wire) {
  bytes out;
  frame::encode_message(channel, wire.data(), wire.size(), out);
  return out;
}

bytes service_frame(std::uint32_t id, const bytes* params) {
  return message_frame(service_channel, parlo_wire(id, params));
}

// A listeners message for `pid` with `count` listeners ("alerts", prefix + i).
bytes listeners_buffer(std::uint32_t pid, std::size_t count, const std::string& prefix) {
  listener_list list;
  for (std::size_t i = 0; i < count; ++i) {
    list.push_back(listener{"alerts", count == 1 ? prefix : prefix + std::to_string(i)});
  }
  return comm::encode_listeners(pid, list);
}

// A listeners message that breaks a reader's rules in one way: "no-ids" (a
// listener without its id), "no-vector" (no listeners field), "too-many"
// (1,000,000 listener tables, over the verifier's table limit; the tables
// share their strings so the buffer stays under 16 MB).
bytes broken_listeners(const std::string& how, std::uint32_t pid) {
  flatbuffers::FlatBufferBuilder builder(1024);
  std::vector<flatbuffers::Offset<comm::wire::listener>> tables;
  if (how == "no-ids") {
    const auto channel = builder.CreateString("alerts");
    comm::wire::listenerBuilder table(builder);
    table.add_channel(channel);
    tables.push_back(table.Finish());
  } else if (how == "too-many") {
    const auto text = builder.CreateString("x");
    tables.reserve(1000000);
    for (int i = 0; i < 1000000; ++i) {
      comm::wire::listenerBuilder table(builder);
      table.add_id(text);
      table.add_channel(text);
      tables.push_back(table.Finish());
    }
  } else if (how != "no-vector") {
    return bytes();
  }
  flatbuffers::Offset<flatbuffers::Vector<flatbuffers::Offset<comm::wire::listener>>> vector;
  if (how != "no-vector") vector = builder.CreateVector(tables);
  comm::wire::listeners_messageBuilder root(builder);
  if (how != "no-vector") root.add_listeners(vector);
  root.add_pid(pid);
  builder.Finish(root.Finish());
  return bytes(builder.GetBufferPointer(), builder.GetBufferPointer() + builder.GetSize());
}

bytes hello_frame(const std::string& bus, std::uint16_t version = frame::protocol_version) {
  frame::hello hello;
  hello.version = version;
  hello.bus_name = bus;
  hello.channels = {"alerts", service_channel};
  bytes out;
  frame::encode_hello(hello, out);  // writes whatever version it is given
  return out;
}

// A frame header: length field and type byte.
bytes header(std::uint32_t length, unsigned char type) {
  return bytes{static_cast<unsigned char>(length), static_cast<unsigned char>(length >> 8),
               static_cast<unsigned char>(length >> 16), static_cast<unsigned char>(length >> 24),
               type};
}

// Ownership: main owns the one connection; the reader thread reads it, the
// command thread writes it. Both use overlapped I/O on the one handle, since
// synchronous I/O on a handle is serialised and a pending read would hold
// every write back.
class connection {
 public:
  connection() = default;
  connection(const connection&) = delete;
  connection& operator=(const connection&) = delete;
  ~connection() {
    close();
    ::CloseHandle(stop_event_);
  }

  DWORD open(const std::wstring& path, ULONG& server_pid) {
    close();
    HANDLE pipe = INVALID_HANDLE_VALUE;
    // Every instance may be taken for a moment, between a client and the
    // server's next instance: wait for one, as a client of a busy pipe does.
    for (int attempt = 0; attempt < 50; ++attempt) {
      // SECURITY_IDENTIFICATION: the server may learn who we are, no more.
      pipe = ::CreateFileW(
          path.c_str(), GENERIC_READ | GENERIC_WRITE, /* share_mode */ 0, /* security */ nullptr,
          OPEN_EXISTING,
          /* flags */ FILE_FLAG_OVERLAPPED | SECURITY_SQOS_PRESENT | SECURITY_IDENTIFICATION,
          /* template_file */ nullptr);
      const DWORD err = ::GetLastError();
      if (pipe != INVALID_HANDLE_VALUE) break;
      if (err != ERROR_PIPE_BUSY) return err;
      ::WaitNamedPipeW(path.c_str(), /* timeout_ms */ 100);
    }
    if (pipe == INVALID_HANDLE_VALUE) return ERROR_PIPE_BUSY;
    pipe_ = pipe;
    server_pid = 0;
    ::GetNamedPipeServerProcessId(pipe_, &server_pid);
    reader_ = std::thread([this] { read_loop(); });
    return 0;
  }

  // Writes all of `data`, waiting at most write_timeout_ms. 0 or the code.
  DWORD write(const bytes& data) {
    if (pipe_ == nullptr) return ERROR_INVALID_HANDLE;
    HANDLE event = ::CreateEventW(nullptr, /* manual_reset */ TRUE, FALSE, nullptr);
    if (event == nullptr) return ::GetLastError();
    std::size_t done = 0;
    DWORD result = 0;
    while (done < data.size() && result == 0) {
      OVERLAPPED ov{};
      ov.hEvent = event;
      const DWORD chunk = static_cast<DWORD>(std::min<std::size_t>(data.size() - done, 1u << 20));
      DWORD put = 0;
      if (!::WriteFile(pipe_, data.data() + done, chunk, nullptr, &ov)) {
        const DWORD err = ::GetLastError();
        if (err != ERROR_IO_PENDING) {
          result = err;
          break;
        }
        if (::WaitForSingleObject(event, write_timeout_ms) != WAIT_OBJECT_0) {
          ::CancelIoEx(pipe_, &ov);
          ::GetOverlappedResult(pipe_, &ov, &put, /* wait */ TRUE);
          result = WAIT_TIMEOUT;
          break;
        }
      }
      if (!::GetOverlappedResult(pipe_, &ov, &put, /* wait */ TRUE)) {
        result = ::GetLastError();
        break;
      }
      done += put;
    }
    ::CloseHandle(event);
    return result;
  }

  void close() {
    if (pipe_ == nullptr) return;
    ::SetEvent(stop_event_);
    if (reader_.joinable()) reader_.join();
    ::CloseHandle(pipe_);
    pipe_ = nullptr;
    ::ResetEvent(stop_event_);
  }

 private:
  void read_loop() {
    HANDLE event = ::CreateEventW(nullptr, /* manual_reset */ TRUE, FALSE, nullptr);
    frame::frame_reader reader;
    std::vector<unsigned char> buffer(64 * 1024);
    DWORD err = 0;
    bool stopped = false;
    for (;;) {
      OVERLAPPED ov{};
      ov.hEvent = event;
      DWORD got = 0;
      if (!::ReadFile(pipe_, buffer.data(), static_cast<DWORD>(buffer.size()), nullptr, &ov) &&
          ::GetLastError() != ERROR_IO_PENDING) {
        err = ::GetLastError();
        break;
      }
      HANDLE waits[2] = {stop_event_, event};
      if (::WaitForMultipleObjects(2, waits, /* wait_all */ FALSE, INFINITE) == WAIT_OBJECT_0) {
        // The buffer must outlive the read: cancel it and wait for the end.
        ::CancelIoEx(pipe_, &ov);
        ::GetOverlappedResult(pipe_, &ov, &got, /* wait */ TRUE);
        stopped = true;
        break;
      }
      if (!::GetOverlappedResult(pipe_, &ov, &got, /* wait */ TRUE)) {
        err = ::GetLastError();
        break;
      }
      const unsigned char* data = buffer.data();
      std::size_t size = got;
      while (size > 0 && !reader.failed()) {
        const std::size_t used = reader.feed(data, size);
        data += used;
        size -= used;
        if (reader.complete()) {
          report(reader);
          reader.next();
        }
      }
      if (reader.failed()) {
        say(std::string("server sent a bad frame: ") + frame::status_text(reader.state()));
        break;
      }
    }
    ::CloseHandle(event);
    if (!stopped) say("closed err=" + std::to_string(err));
  }

  static void report(const frame::frame_reader& reader) {
    const bytes& payload = reader.payload();
    if (reader.type() == frame::frame_type::hello) {
      frame::hello hello;
      frame::decode_hello(payload.data(), payload.size(), hello);
      say("frame hello bus=" + hello.bus_name + " channels=" + std::to_string(hello.channels.size()));
      return;
    }
    frame::message_view message;
    if (frame::decode_message(payload.data(), payload.size(), message) != frame::status::ok) return;
    parlo::codec::message_content content;
    if (message.channel == service_channel &&
        parlo::codec::decode(message.wire, message.wire_size, content) == parlo::codec::status::ok) {
      if (content.id == 1) {
        say("frame request");
        return;
      }
      for (const auto& field : content.fields) {
        std::uint32_t pid = 0;
        listener_list list;
        if (content.id == 2 && field.name == "params" &&
            comm::decode_listeners(field.data.data(), field.data.size(), pid, list)) {
          say("frame listeners pid=" + std::to_string(pid) + " count=" + std::to_string(list.size()));
          return;
        }
      }
    }
    say("frame message channel=" + std::string(message.channel) +
        " bytes=" + std::to_string(message.wire_size));
  }

  HANDLE pipe_ = nullptr;
  // Manual-reset: set by close() to end the reader.
  HANDLE stop_event_ = ::CreateEventW(nullptr, /* manual_reset */ TRUE, FALSE, nullptr);
  std::thread reader_;
};

// The bytes a command sends, or an empty vector for an unknown command.
// `words[0]` is the command.
bytes bytes_for(const std::vector<std::string>& words) {
  const std::string& verb = words[0];
  auto arg = [&](std::size_t i, const std::string& fallback) {
    return i < words.size() ? words[i] : fallback;
  };
  auto pid_arg = [&](std::size_t i) -> std::uint32_t {
    const std::string text = arg(i, "self");
    return text == "self" ? ::GetCurrentProcessId() : static_cast<std::uint32_t>(std::stoul(text));
  };
  if (verb == "hello") return hello_frame(arg(1, "main"));
  if (verb == "hello-version") return hello_frame("main", static_cast<std::uint16_t>(std::stoul(arg(1, "2"))));
  if (verb == "listeners") {
    // listeners PID COUNT PREFIX: COUNT listeners of channel "alerts".
    const bytes params = listeners_buffer(pid_arg(1), std::stoul(arg(2, "1")), arg(3, "h"));
    return service_frame(2, &params);
  }
  if (verb == "burst") {
    // burst N COUNT: N lists of COUNT listeners back to back, each unlike
    // the one before, so the receiver merges and notifies for every one.
    const unsigned long lists = std::stoul(arg(1, "100"));
    const unsigned long count = std::stoul(arg(2, "1000"));
    bytes out;
    for (unsigned long i = 0; i < lists; ++i) {
      const bytes params = listeners_buffer(::GetCurrentProcessId(), count, i % 2 == 0 ? "a" : "b");
      const bytes one = service_frame(2, &params);
      out.insert(out.end(), one.begin(), one.end());
    }
    return out;
  }
  if (verb == "broken-listeners") {
    const bytes params = broken_listeners(arg(1, ""), pid_arg(2));
    return params.empty() ? bytes() : service_frame(2, &params);
  }
  if (verb == "request") return service_frame(1, nullptr);
  if (verb == "service-no-blob") return service_frame(2, nullptr);
  if (verb == "service-empty-blob") {
    const bytes empty;
    return service_frame(2, &empty);
  }
  if (verb == "service-garbage") {
    // service-garbage ID SIZE: a params blob of SIZE pseudo-random bytes.
    bytes params(std::stoul(arg(2, "64")));
    std::uint32_t state = 12345;
    for (unsigned char& b : params) {
      state = state * 1103515245u + 12345u;
      b = static_cast<unsigned char>(state >> 16);
    }
    return service_frame(static_cast<std::uint32_t>(std::stoul(arg(1, "2"))), &params);
  }
  if (verb == "oversized-listeners") {
    // A params blob one byte over the messaging library's 16 MiB: the frame
    // is within the pipe limit, the message is not.
    // Written by hand: the codec refuses to encode what breaks its limits.
    const std::uint32_t size = (16u << 20) + 1;
    bytes wire = {'P', 'R', 'L', '1', 2, 0, 0, 0, 1, 0, 0, 0, 6, 0};
    for (int shift = 0; shift < 32; shift += 8) wire.push_back(static_cast<unsigned char>(size >> shift));
    for (char c : std::string("params")) wire.push_back(static_cast<unsigned char>(c));
    wire.resize(wire.size() + size, 'x');
    return message_frame(service_channel, wire);
  }
  if (verb == "undecodable") {
    const bytes junk = {'n', 'o', 't', ' ', 'p', 'a', 'r', 'l', 'o'};
    return message_frame(service_channel, junk);
  }
  if (verb == "oversized-frame") {
    bytes out = header(static_cast<std::uint32_t>(frame::max_frame_length + 1), 2);
    out.resize(out.size() + 64, 'x');
    return out;
  }
  if (verb == "empty-frame") return header(0, 2);
  if (verb == "unknown-type") {
    bytes out = header(6, 0x7F);
    out.resize(out.size() + 5, 'x');
    return out;
  }
  if (verb == "text") {
    // What a stray HTTP client would send: its first four bytes are a
    // length of about half a gigabyte.
    const std::string text = "GET / HTTP/1.1\r\nHost: localhost\r\n\r\n";
    return bytes(text.begin(), text.end());
  }
  if (verb == "bad-name") {
    // A message frame whose channel name is empty.
    bytes out = header(8, 2);
    for (const char b : {'\0', '\0', 'P', 'R', 'L', '1', '\0'}) out.push_back(static_cast<unsigned char>(b));
    return out;
  }
  if (verb == "truncated-frame") {
    // Declares 1000 bytes, sends the type byte and 100; the rest never comes.
    bytes out = header(1000, 2);
    out.resize(out.size() + 100, 'x');
    return out;
  }
  if (verb == "truncated-listeners") {
    // A whole listeners frame but its last byte.
    const bytes params = listeners_buffer(pid_arg(1), 50, "t");
    bytes out = service_frame(2, &params);
    out.pop_back();
    return out;
  }
  return bytes();
}

std::vector<std::string> split(const std::string& line) {
  std::vector<std::string> words;
  std::istringstream in(line);
  for (std::string word; in >> word;) words.push_back(word);
  return words;
}

}  // namespace

int main(int argc, char** argv) {
  std::string config;
  for (int i = 1; i + 1 < argc; ++i) {
    if (std::string(argv[i]) == "--config") config = argv[i + 1];
  }
  std::string pipe;
  std::getline(std::ifstream(config), pipe);
  while (!pipe.empty() && (pipe.back() == '\r' || pipe.back() == ' ')) pipe.pop_back();
  if (pipe.empty()) {
    std::fprintf(stderr, "hostile_peer: no pipe in the file after --config\n");
    return 2;
  }
  say("ready pid=" + std::to_string(::GetCurrentProcessId()));

  connection link;
  for (std::string line; std::getline(std::cin, line);) {
    const std::vector<std::string> words = split(line);
    if (words.empty()) continue;
    const std::string& verb = words[0];
    try {
      if (verb == "quit") break;
      if (verb == "connect") {
        ULONG server = 0;
        const DWORD err = link.open(widen(pipe), server);
        say(err == 0 ? "connected server=" + std::to_string(server) : "failed connect err=" + std::to_string(err));
      } else if (verb == "close") {
        link.close();
        say("sent close");
      } else if (verb == "echo") {
        say(line.size() > 5 ? line.substr(5) : "");
      } else {
        const bytes data = bytes_for(words);
        if (data.empty()) {
          say("failed unknown command " + verb);
          continue;
        }
        const DWORD err = link.write(data);
        say(err == 0 ? "sent " + verb + " " + std::to_string(data.size())
                     : "failed " + verb + " err=" + std::to_string(err));
      }
    } catch (const std::exception& e) {
      say("failed " + verb + ": " + e.what());
    }
  }
  return 0;
}
