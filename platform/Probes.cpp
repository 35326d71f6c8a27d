#include "platform/Probes.h"

// Semaphores make the *_ENABLED() checks read a counter that a tracer raises
// when it attaches, which is what lets the guarded probes skip building their
// strings. The generated header defines the same; defining it first keeps that
// true whatever sdt.h another include pulled in earlier.
#ifndef _SDT_HAS_SEMAPHORES
#define _SDT_HAS_SEMAPHORES 1
#endif
#include "platform/vantreld_probes.h"

namespace vantrel::probes {

void clientNew(int pid) {
  VANTRELD_CLIENT_NEW(pid);
}

void clientDone(int pid) {
  VANTRELD_CLIENT_DONE(pid);
}

void request(int pid, const char* type) {
  VANTRELD_REQUEST(pid, type);
}

bool requestInputEnabled() {
  return VANTRELD_REQUEST_INPUT_ENABLED();
}

void requestInput(int pid, const char* description) {
  VANTRELD_REQUEST_INPUT(pid, description);
}

bool requestOutputEnabled() {
  return VANTRELD_REQUEST_OUTPUT_ENABLED();
}

void requestOutput(int pid, const char* description) {
  VANTRELD_REQUEST_OUTPUT(pid, description);
}

void dbLoad(const char* domain, uint64_t code) {
  VANTRELD_DB_LOAD(domain, code);
}

void discoverRaw(unsigned int count) {
  VANTRELD_DISCOVER_RAW(count);
}

void pluginAdd(const char* path) {
  VANTRELD_PLUGIN_ADD(path);
}

void pluginReady(const char* uuid) {
  VANTRELD_PLUGIN_READY(uuid);
}

void pluginRemove(const char* path, bool resolved) {
  VANTRELD_PLUGIN_REMOVE(path, resolved);
}

}  // namespace vantrel::probes
