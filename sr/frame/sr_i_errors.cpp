// sr_i_errors.cpp - the raising functions of sr_i_errors.h: each records one
// message of set 1 of "qv_sr.cat" for the calling thread, with the inserts
// its text asks for, and writes an error trace record when the "Errors"
// category is on.
//
// The raising site comes from sr_i_source_location: the function name is cut
// out of the compiler's full signature, and the module path is the source
// path relative to the project root (the build strips the root) without its
// extension, e.g. "sr/frame/sr_i_read_write_lock".

#include <cstdio>
#include <cstring>
#include <string_view>

#include "frame/sr_i_errors.h"
#include "frame/sr_i_trace.h"

namespace {

constexpr const char *Module_Version = SR_I_MODULE_VERSION;

// The raising site in the form the messages print it.
struct raising_site {
  char function[128];
  char module[256];
  int line;
};

void copy_text(char *p_target, size_t size, std::string_view text) {
  const size_t length = std::min(text.size(), size - 1);
  std::memcpy(p_target, text.data(), length);
  p_target[length] = '\0';
}

raising_site site_of(const sr_i_source_location &where) {
  raising_site site{};
  // "int32_t sr_i_rw_lock_read(sr_i_read_write_lock_t*)" -> "sr_i_rw_lock_read"
  std::string_view function = where.function_name();
  function = function.substr(0, function.find('('));
  if (const size_t last_blank = function.find_last_of(" *&:"); last_blank != function.npos) {
    function.remove_prefix(last_blank + 1);
  }
  copy_text(site.function, sizeof site.function, function.empty() ? "unknown" : function);

  std::string_view module = where.file_name();
  if (const size_t dot = module.rfind('.');
      dot != module.npos && module.find('/', dot) == module.npos) {
    module = module.substr(0, dot);
  }
  copy_text(site.module, sizeof site.module, module);
  site.line = static_cast<int>(where.line());
  return site;
}

template <typename... Inserts>
int32_t raise(int32_t code, int32_t number, const raising_site &site, Inserts... inserts) {
  cu_set_error_1(code, 0, Sr_Message_Catalog, Sr_Message_Set, number, cu_mesgtbl_qv_sr_set[number],
                 inserts...);
  if (sr_i_trace_on(SR_I_TRACE_ERRORS)) {
    tr_record_error_1(Sr_Trace_Component, 0, site.function, static_cast<uint32_t>(site.line),
                      site.module, 0);
  }
  return code;
}

}  // namespace

int32_t sr_i_raise(sr_i_plain_code code, sr_i_source_location where) {
  return raise(code.code, sr_i_plain_message_number(code.code), site_of(where));
}

int32_t sr_i_raise_system_call(const char *p_call, int error_number, sr_i_source_location where) {
  const raising_site site = site_of(where);
  return raise(SR_E_SYSTEM_CALL, SR_I_MESSAGE_SYSTEM_CALL, site, p_call, error_number,
               site.function, site.line, site.module, Module_Version);
}

int32_t sr_i_raise_library_call(const char *p_function, int32_t result,
                                sr_i_source_location where) {
  const raising_site site = site_of(where);
  return raise(SR_E_LIBRARY_CALL, SR_I_MESSAGE_LIBRARY_CALL, site, p_function,
               static_cast<int>(result), site.function, site.line, site.module, Module_Version);
}

int32_t sr_i_raise_no_memory(sr_i_source_location where) {
  const raising_site site = site_of(where);
  return raise(SR_E_NO_MEMORY, SR_I_MESSAGE_NO_MEMORY, site, site.function, site.line, site.module,
               Module_Version);
}

int32_t sr_i_raise_internal(sr_i_source_location where) {
  const raising_site site = site_of(where);
  return raise(SR_E_INTERNAL, SR_I_MESSAGE_INTERNAL, site, site.function, site.line, site.module,
               Module_Version);
}

int32_t sr_i_raise_invalid_path(const char *p_path, sr_i_source_location where) {
  return raise(SR_E_INVALID_PATH, SR_I_MESSAGE_INVALID_PATH, site_of(where),
               p_path ? p_path : "<NULL POINTER>");
}

int32_t sr_i_raise_invalid_criteria(const char *p_criteria, sr_i_source_location where) {
  return raise(SR_E_INVALID_CRITERIA, SR_I_MESSAGE_INVALID_CRITERIA, site_of(where), p_criteria);
}
