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
//   masquerade P rewrites this process's loader data (the first entry of its
//                module list, full and base name) to name image P
//   swap P       renames this program's running image aside (to its name
//                plus ".aside") and copies image P to its path
#include <windows.h>
#include <winternl.h>

#include <algorithm>
#include <cstdio>
#include <fstream>
#include <iostream>
#include <iterator>
#include <string>

#ifdef INTRUDER_PADDING_MB
// Bulk that makes the image slow to hash: a signature over it takes as long
// to verify as that of a large program.
extern const unsigned char padding[];
const unsigned char padding[INTRUDER_PADDING_MB << 20] = {1};
#endif

namespace {

// The x64 loader record of a module, as far as the names.
struct loader_entry {
  LIST_ENTRY in_load_order;
  LIST_ENTRY in_memory_order;
  LIST_ENTRY in_initialization_order;
  void* base;
  void* entry_point;
  ULONG image_size;
  UNICODE_STRING full_name;
  UNICODE_STRING base_name;
};

// What a program may do to its own memory: make the first loaded module
// (the image itself) carry another name.
DWORD masquerade(const std::string& path) {
  static std::wstring full, base;
  full.assign(path.begin(), path.end());
  base = full.substr(full.find_last_of(L'\\') + 1);
  using query_fn = LONG(NTAPI*)(HANDLE, PROCESSINFOCLASS, void*, ULONG, ULONG*);
  const auto query = reinterpret_cast<query_fn>(
      reinterpret_cast<void*>(::GetProcAddress(::GetModuleHandleA("ntdll.dll"), "NtQueryInformationProcess")));
  PROCESS_BASIC_INFORMATION basic{};
  if (query == nullptr || query(::GetCurrentProcess(), ProcessBasicInformation, &basic, sizeof(basic), nullptr) != 0) {
    return ERROR_NOT_SUPPORTED;
  }
  const PEB* peb = basic.PebBaseAddress;
  // PEB_LDR_DATA: the load-order list follows Length, Initialized and SsHandle.
  const auto* lists = reinterpret_cast<const unsigned char*>(peb->Ldr) + 0x10;
  auto* first = reinterpret_cast<loader_entry*>(reinterpret_cast<const LIST_ENTRY*>(lists)->Flink);
  for (auto [name, text] : {std::pair{&first->full_name, &full}, std::pair{&first->base_name, &base}}) {
    name->Buffer = text->data();
    name->Length = static_cast<USHORT>(text->size() * sizeof(wchar_t));
    name->MaximumLength = static_cast<USHORT>(name->Length + sizeof(wchar_t));
  }
  return 0;
}

DWORD swap(const std::string& path) {
  char self[MAX_PATH];
  const std::string image(self, ::GetModuleFileNameA(nullptr, self, MAX_PATH));
  if (!::MoveFileA(image.c_str(), (image + ".aside").c_str())) return ::GetLastError();
  return ::CopyFileA(path.c_str(), image.c_str(), /* fail_if_exists */ TRUE) ? 0 : ::GetLastError();
}

}  // namespace

int main(int argc, char** argv) {
#ifdef INTRUDER_PADDING_MB
  static volatile int keep = 0;
  if (keep != 0) return padding[keep];
#endif
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
    } else if (line.rfind("masquerade ", 0) == 0) {
      err = masquerade(line.substr(11));
    } else if (line.rfind("swap ", 0) == 0) {
      err = swap(line.substr(5));
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
