// cu_error.cpp - the per-thread error information of libqv_cu:
// cu_set_error_1, cu_set_no_error_1, cu_get_error_1 and cu_rel_error_1.
//
// Each thread has one record (code, message set and number, formatted text)
// in thread-local storage, so threads never see each other's errors and no
// lock is needed. The text is formatted when the error is raised, from the
// catalog's translation when there is one (cu_catalog.cpp) and the built-in
// default otherwise (cu_message_format.cpp).

#include <cstdarg>
#include <cstdlib>
#include <cstring>
#include <new>
#include <string>
#include <string_view>

#include "cu_i_message.h"
#include "qv_cu.h"

namespace {

// Whether the thread's record may hold anything. A plain flag needs no
// thread-local construction on access, so the call every successful library
// call ends with, clearing an already clear record, costs one load. The
// initial-exec model makes that load relative to the thread pointer instead
// of a call to __tls_get_addr; one byte of static thread-local space is
// available even to a library loaded with dlopen.
[[gnu::tls_model("initial-exec")]] thread_local bool This_Thread_Error_Set = false;
// Whether the thread's record is destroyed already. The main thread's
// records go before the process's static objects and atexit handlers, which
// may still call a library (closing what they hold): from then on errors
// are reported by code alone.
[[gnu::tls_model("initial-exec")]] thread_local bool This_Thread_Error_Gone = false;

struct thread_error {
  int32_t code = 0;
  int32_t set = 0;
  int32_t message = 0;
  std::string text;

  thread_error() = default;
  thread_error(const thread_error &) = delete;
  thread_error &operator=(const thread_error &) = delete;
  ~thread_error() {
    This_Thread_Error_Gone = true;
    This_Thread_Error_Set = false;
  }
};

thread_local thread_error This_Thread_Error;

}  // namespace

extern "C" int32_t cu_set_error_1(int32_t code, int32_t /*reserved*/, const char *p_catalog,
                                  int32_t set, int32_t message, const char *p_default_text, ...) {
  if (This_Thread_Error_Gone) {
    return code;
  }
  This_Thread_Error_Set = true;
  thread_error &error = This_Thread_Error;
  error.code = code;
  error.set = set;
  error.message = message;
  error.text.clear();
  va_list arguments;
  va_start(arguments, p_default_text);
  try {
    error.text =
        cu_i_format_message(cu_i_catalog_text(p_catalog, set, message), p_default_text, arguments);
  } catch (...) {
    // Out of memory while formatting: the code is what matters; keep it.
    error.text.clear();
  }
  va_end(arguments);
  return code;
}

extern "C" int32_t cu_set_no_error_1(void) {
  if (!This_Thread_Error_Set) {
    return 0;
  }
  This_Thread_Error_Set = false;
  thread_error &error = This_Thread_Error;
  error.code = 0;
  error.set = 0;
  error.message = 0;
  error.text.clear();
  return 0;
}

extern "C" int32_t cu_get_error_1(cu_error_t **pp_error) {
  if (pp_error == nullptr) {
    return CU_RESULT_NULL_ARGUMENT;
  }
  const bool gone = This_Thread_Error_Gone;
  const std::string_view text = gone ? std::string_view() : This_Thread_Error.text;
  // One block: the record, then its text, so one free releases both.
  void *p_block = std::malloc(sizeof(cu_error_t) + text.size() + 1);
  if (p_block == nullptr) {
    *pp_error = nullptr;
    return CU_RESULT_NO_MEMORY;
  }
  auto *p_error = static_cast<cu_error_t *>(p_block);
  char *p_text = static_cast<char *>(p_block) + sizeof(cu_error_t);
  if (!text.empty()) {
    std::memcpy(p_text, text.data(), text.size());
  }
  p_text[text.size()] = '\0';
  p_error->code = gone ? 0 : This_Thread_Error.code;
  p_error->set = gone ? 0 : This_Thread_Error.set;
  p_error->message = gone ? 0 : This_Thread_Error.message;
  p_error->p_text = p_text;
  *pp_error = p_error;
  return CU_RESULT_OK;
}

extern "C" void cu_rel_error_1(cu_error_t *p_error) {
  std::free(p_error);
}
