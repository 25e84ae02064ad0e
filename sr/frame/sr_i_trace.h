/*
 * sr_i_trace.h - the registry's trace component "_SRA": its categories,
 * the levels the trace library fills in, and the entry and exit records of
 * the exported functions. Every record is guarded by a level test so that a
 * process with tracing off makes no trace call at all.
 */
#ifndef SR_I_TRACE_H
#define SR_I_TRACE_H

#include <atomic>
#include <cstdint>

#include "qv_tr.h"

inline constexpr const char *Sr_Trace_Component = "_SRA";

/* Category numbers: indexes of Sr_Trace_Level_Of_Detail. */
enum sr_i_trace_category : int {
  SR_I_TRACE_API = 0,
  SR_I_TRACE_ERRORS = 1,
  SR_I_TRACE_WHEREVER = 2
};

extern const tr_category_t Sr_Trace_Categories[3];
/* One level per category, written by the trace library at registration and
 * read without a lock on every call (hence the atomic accesses). */
extern unsigned char Sr_Trace_Level_Of_Detail[3];
extern std::atomic<int> Sr_Library_Registered_For_Trace;

inline bool sr_i_trace_on(sr_i_trace_category category) {
  return __atomic_load_n(&Sr_Trace_Level_Of_Detail[category], __ATOMIC_RELAXED) != 0;
}

/* Registers "_SRA" with the trace library once per process. */
void sr_i_register_for_trace();

#endif /* SR_I_TRACE_H */
