#include "platform/trace/Probes.h"

#include <sys/sdt.h>

// The probe names contain hyphens. <sys/sdt.h> stringifies the name, so the token sequence `client-new` becomes
// the note name "client-new" as it is. Only the semaphore symbol is built by token pasting, which a hyphen breaks;
// for the two probes that have one, the two macros that name it are replaced around the probe site so that they
// name BXD_SEMAPHORE instead. Every other probe is written with the header's own macros and no semaphore.

extern "C" {
// In the ".probes" section where tracers expect semaphores; a tracer adds one while it is attached.
__attribute__((used, section(".probes"))) volatile unsigned short bxd_request_input_semaphore = 0;
__attribute__((used, section(".probes"))) volatile unsigned short bxd_request_output_semaphore = 0;
}

// Layout tools would put spaces around the hyphens, and the spaces would become part of the probe names.
// clang-format off
namespace bexil::trace {

void clientNew(int pid) { STAP_PROBE1(bxd, client-new, pid); }

void clientDone(int pid) { STAP_PROBE1(bxd, client-done, pid); }

void request(int pid, const char* name) { STAP_PROBE2(bxd, request, pid, name); }

void dbLoad(const char* domain, uint64_t code) { STAP_PROBE2(bxd, db-load, domain, code); }

void discoverRaw(unsigned count) { STAP_PROBE1(bxd, discover-raw, count); }

void pluginAdd(const char* plugin) { STAP_PROBE1(bxd, plugin-add, plugin); }

void pluginRemove(const char* plugin, bool flag) { STAP_PROBE2(bxd, plugin-remove, plugin, flag); }

void pluginReady(const char* plugin) { STAP_PROBE1(bxd, plugin-ready, plugin); }

#undef _SDT_SEMAPHORE
#undef _SDT_NOTE_SEMAPHORE_USE
#define _SDT_SEMAPHORE(p, n) _SDT_ASM_1(_SDT_ASM_ADDR BXD_SEMAPHORE)
#define _SDT_NOTE_SEMAPHORE_USE(p, n) __asm__ __volatile__("" ::"m"(BXD_SEMAPHORE));

#define BXD_SEMAPHORE bxd_request_input_semaphore
void requestInput(int pid, const char* text) { STAP_PROBE2(bxd, request-input, pid, text); }
#undef BXD_SEMAPHORE

#define BXD_SEMAPHORE bxd_request_output_semaphore
void requestOutput(int pid, const char* text) { STAP_PROBE2(bxd, request-output, pid, text); }
#undef BXD_SEMAPHORE

}  // namespace bexil::trace
// clang-format on
