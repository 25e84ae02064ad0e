// sr_i_trace.cpp - the registry's trace component "_SRA": its categories,
// its levels, and its registration with the trace library, done by the
// first sr_open_tree_1 of the process.

#include "frame/sr_i_trace.h"

const tr_category_t Sr_Trace_Categories[3] = {
    {SR_I_TRACE_API, "API"}, {SR_I_TRACE_ERRORS, "Errors"}, {SR_I_TRACE_WHEREVER, "Wherever"}};
unsigned char Sr_Trace_Level_Of_Detail[3] = {0, 0, 0};
std::atomic<int> Sr_Library_Registered_For_Trace{0};

void sr_i_register_for_trace() {
  // Two threads racing here both register; the trace library takes that.
  if (Sr_Library_Registered_For_Trace.load(std::memory_order_relaxed) == 0) {
    tr_register_component_1(Sr_Trace_Component, Sr_Trace_Level_Of_Detail, Sr_Trace_Categories, 3);
    Sr_Library_Registered_For_Trace.store(1, std::memory_order_relaxed);
  }
}
