#pragma once

// The daemon's static trace probes, provider "bxd". Each probe site exists exactly once, inside Probes.cpp, and
// costs a single no-op instruction until a tracer (bpftrace, perf, SystemTap) attaches to it. The two probes whose
// argument is a rendering of a whole message have semaphores: call sites test requestInputEnabled() /
// requestOutputEnabled() first and build the text only when a tracer is listening. Callable from any thread.

#include <cstdint>

// The semaphores a tracer increments while it is attached to "request-input" / "request-output".
extern "C" {
extern volatile unsigned short bxd_request_input_semaphore;
extern volatile unsigned short bxd_request_output_semaphore;
}

namespace bexil::trace {

// "client-new" (int pid): a client connection has been set up.
void clientNew(int pid);
// "client-done" (int pid): a client connection has died.
void clientDone(int pid);

inline bool requestInputEnabled() { return __builtin_expect(bxd_request_input_semaphore != 0, 0); }
// "request-input" (int pid, string message): a request message arrived; `text` renders the whole message.
void requestInput(int pid, const char* text);

// "request" (int pid, string name): a request is dispatched.
void request(int pid, const char* name);

inline bool requestOutputEnabled() { return __builtin_expect(bxd_request_output_semaphore != 0, 0); }
// "request-output" (int pid, string reply): a reply is sent; `text` renders the whole reply.
void requestOutput(int pid, const char* text);

// "db-load" (string domain, uint64 code): the annotation document failed to load with this error.
void dbLoad(const char* domain, uint64_t code);
// "discover-raw" (unsigned count): a discovery request has its raw result of `count` plug-ins.
void discoverRaw(unsigned count);
// "plugin-add" (string): a plug-in is registered.
void pluginAdd(const char* plugin);
// "plugin-remove" (string, bool): a plug-in is unregistered.
void pluginRemove(const char* plugin, bool flag);
// "plugin-ready" (string): a plug-in is made ready for a host.
void pluginReady(const char* plugin);

}  // namespace bexil::trace
