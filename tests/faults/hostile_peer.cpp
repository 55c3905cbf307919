// A client of the pipe protocol that writes whatever bytes it is given, so
// that a serving process can be sent what no gateway sends: broken frames,
// malformed and oversized messages, a frame cut off half-way. Signed like
// every program of the build, so that it is admitted. It never reads: what a
// server sends one client fits in the pipe's buffer.
//
//   hostile_peer --config FILE    FILE holds the pipe path; other arguments are ignored
//
// Prints "ready pid=N", then runs one command per line of standard input and
// answers the n-th with "#n ok" or "#n failed err=E":
//   connect      opens the pipe; the answer names the server ("#n ok server=PID")
//   send FILE    writes the file's bytes, all of them
//   close        closes the pipe
#include <windows.h>

#include <algorithm>
#include <cstdio>
#include <fstream>
#include <iostream>
#include <iterator>
#include <string>

int main(int argc, char** argv) {
  std::string pipe_path;
  for (int i = 1; i + 1 < argc; ++i) {
    if (std::string(argv[i]) == "--config") std::getline(std::ifstream(argv[i + 1]), pipe_path);
  }
  std::printf("ready pid=%lu\n", ::GetCurrentProcessId());
  std::fflush(stdout);
  HANDLE pipe = INVALID_HANDLE_VALUE;
  int sequence = 0;
  for (std::string line; std::getline(std::cin, line) && line != "quit";) {
    DWORD err = ERROR_BAD_COMMAND;
    ULONG server = 0;
    if (line == "connect") {
      // SECURITY_IDENTIFICATION: the server may learn who we are, no more.
      // Every instance may be taken for a moment, between a client and the
      // server's next instance: a busy pipe is waited for.
      for (int attempt = 0; attempt < 50; ++attempt) {
        pipe = ::CreateFileA(pipe_path.c_str(), GENERIC_READ | GENERIC_WRITE, /* share_mode */ 0,
                             /* security */ nullptr, OPEN_EXISTING,
                             /* flags */ SECURITY_SQOS_PRESENT | SECURITY_IDENTIFICATION, /* template_file */ nullptr);
        err = pipe == INVALID_HANDLE_VALUE ? ::GetLastError() : 0;
        if (err != ERROR_PIPE_BUSY) break;
        ::WaitNamedPipeA(pipe_path.c_str(), /* timeout_ms */ 100);
      }
      ::GetNamedPipeServerProcessId(pipe, &server);
    } else if (line == "close") {
      err = ::CloseHandle(pipe) ? 0 : ::GetLastError();
    } else if (line.rfind("send ", 0) == 0) {
      std::ifstream in(line.substr(5), std::ios::binary);
      const std::string data{std::istreambuf_iterator<char>(in), std::istreambuf_iterator<char>()};
      err = 0;
      for (std::size_t done = 0; done < data.size() && err == 0;) {
        DWORD put = 0;
        const auto chunk = static_cast<DWORD>(std::min<std::size_t>(data.size() - done, 1u << 20));
        err = ::WriteFile(pipe, data.data() + done, chunk, &put, /* overlapped */ nullptr) ? 0 : ::GetLastError();
        done += put;
      }
    }
    const std::string answer = server != 0 ? "ok server=" + std::to_string(server) : "ok";
    std::printf("#%d %s\n", ++sequence, err == 0 ? answer.c_str() : ("failed err=" + std::to_string(err)).c_str());
    std::fflush(stdout);
  }
  return 0;
}
