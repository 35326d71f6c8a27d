#pragma once
// The daemon's static trace probes, provider "vantreld".
//
// Each function fires one probe. With no tracer attached a probe site is a
// single no-op instruction, so callers fire them unconditionally. The two
// probes whose argument is a printable description of a whole message are
// guarded: their templated forms build the string only when a tracer has
// enabled that probe, and the string lives only for the firing.
//
// The probe sites are defined once, in one object that every executable
// links (vantrel_executable), so each binary carries all ten probes whether
// or not its own code fires them.

#include <concepts>
#include <cstdint>
#include <string>

namespace vantrel::probes {

// "client-new": a client object has been set up for a new connection.
void clientNew(int pid);
// "client-done": a client's connection became invalid, after its holds went.
void clientDone(int pid);
// "request": a transaction is about to be dispatched; type is the request type.
void request(int pid, const char* type);

// "request-input": an incoming message, described. Enabled only while a tracer
// has enabled the probe.
bool requestInputEnabled();
void requestInput(int pid, const char* description);
// "request-output": a reply about to be sent, described.
bool requestOutputEnabled();
void requestOutput(int pid, const char* description);

// Guarded forms: build the string only when a tracer enabled the probe.
// describe() must return something with c_str() (a std::string).
template <typename F>
requires std::invocable<F&>
void requestInput(int pid, F&& describe) {
  if (requestInputEnabled()) requestInput(pid, describe().c_str());
}
template <typename F>
requires std::invocable<F&>
void requestOutput(int pid, F&& describe) {
  if (requestOutputEnabled()) requestOutput(pid, describe().c_str());
}

// "db-load": the annotation database failed to load; code sign-extended.
void dbLoad(const char* domain, uint64_t code);
// "discover-raw": the number of candidate plug-ins before filtering.
void discoverRaw(unsigned int count);
// "plugin-add": one path of an "add" request.
void pluginAdd(const char* path);
// "plugin-ready": one plug-in UUID string of a "ready" request.
void pluginReady(const char* uuid);
// "plugin-remove": one path of a "remove" request; resolved says whether the
// path could be made canonical.
void pluginRemove(const char* path, bool resolved);

}  // namespace vantrel::probes
