// A peer for the trust tests. The build signs it in several ways (and makes a
// tampered copy), so it serves both as an image to read signatures from and
// as a running process to classify and watch. Once running it writes one
// byte to its standard output, then stays alive until its standard input
// reaches its end (the parent closes the pipe), and exits 0.
#include <windows.h>

#include <cstring>

// Signed content that the tampered copy changes; nothing depends on its
// value, so the changed program still runs.
static const char tamper_marker[] = "vorbel_child_tamper_marker_7f3a";

int main(int argc, char** argv) {
  if (argc > 1 && std::strcmp(argv[1], tamper_marker) == 0) return 2;
  // Tell the parent that the process is fully up (its module list readable).
  DWORD written = 0;
  ::WriteFile(::GetStdHandle(STD_OUTPUT_HANDLE), "r", 1, &written, /* overlapped */ nullptr);
  HANDLE input = ::GetStdHandle(STD_INPUT_HANDLE);
  char buffer[64];
  DWORD read = 0;
  while (::ReadFile(input, buffer, sizeof(buffer), &read, /* overlapped */ nullptr) && read > 0) {
  }
  return 0;
}
