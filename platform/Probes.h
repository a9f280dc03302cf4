// The daemon's static tracing probes: USDT probes of provider "omd", visible to any USDT tracer
// (bpftrace, perf, SystemTap). Each probe has a semaphore that a tracer raises while attached, so a
// call site can skip building an expensive argument:
//
//     if (OM_PROBE_ENABLED(request__input)) {
//         auto text = message.description();
//         OM_PROBE2(request__input, pid, text.c_str());
//     }
//
// A probe site is a single nop when no tracer is attached. A misspelled probe name fails to link,
// because its semaphore does not exist.
#pragma once

#include <cstdint>

#if defined(_SYS_SDT_H) && !defined(_SDT_HAS_SEMAPHORES)
#error "sys/sdt.h was included without semaphores before platform/Probes.h"
#endif
#ifndef _SDT_HAS_SEMAPHORES
// sys/sdt.h's own switch for semaphore-carrying probes.
#define _SDT_HAS_SEMAPHORES 1 // NOLINT(bugprone-reserved-identifier)
#endif
#include <sys/sdt.h>

// Names follow the USDT convention: "__" in the symbol is "-" in the probe name tracers show. The
// double underscore is sys/sdt.h's, so these names cannot avoid the reserved form.
// NOLINTBEGIN(bugprone-reserved-identifier)
extern "C" {
extern unsigned short omd_client__new_semaphore; // (int pid)
extern unsigned short omd_client__done_semaphore; // (int pid)
extern unsigned short omd_request__input_semaphore; // (int pid, const char* description)
extern unsigned short omd_request_semaphore; // (int pid, const char* name)
extern unsigned short omd_request__output_semaphore; // (int pid, const char* description)
extern unsigned short omd_discover__raw_semaphore; // (unsigned int count)
extern unsigned short omd_plugin__add_semaphore; // (const char* path)
extern unsigned short omd_plugin__remove_semaphore; // (const char* path, bool)
extern unsigned short omd_plugin__ready_semaphore; // (const char* path)
extern unsigned short omd_db__load_semaphore; // (const char* path, uint64_t)
}
// NOLINTEND(bugprone-reserved-identifier)

// Read through a volatile access: the tracer changes the semaphore behind the compiler's back.
#define OM_PROBE_ENABLED(probe)                                                                                        \
    __builtin_expect(*static_cast<volatile unsigned short*>(&omd_##probe##_semaphore) != 0, 0)

#define OM_PROBE1(probe, a) STAP_PROBE1(omd, probe, a)
#define OM_PROBE2(probe, a, b) STAP_PROBE2(omd, probe, a, b)
