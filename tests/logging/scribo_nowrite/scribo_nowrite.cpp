// A scribo.dll that has every export the binding calls except LogWrite.
extern "C" {
void LogInit() {}
void LogDeinit() {}
void LogUninitMetrics() {}
void LogRemoveModule(const char*) {}
}
