// cu_iconv.cpp - code-set conversion between the process's locale and the
// stored form of strings (UTF-8), on top of the C library's iconv.
//
// A handle is opened for one direction. When the two code sets agree (the
// caller adds CU_ICONV_UNCHANGED) no iconv descriptor is opened and strings
// are copied byte for byte. An iconv descriptor carries shift state and is
// not safe for concurrent use, so each handle serialises its conversions.

#include <iconv.h>
#include <langinfo.h>
#include <locale.h>
#include <strings.h>

#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <mutex>
#include <new>
#include <string>
#include <string_view>
#include <system_error>

#include "qv_cu.h"

struct cu_iconv_struct_t {
  iconv_t descriptor = reinterpret_cast<iconv_t>(-1);  // none when the bytes pass unchanged
  std::mutex lock;
};

namespace {

constexpr const char *Stored_Code_Set = "UTF-8";
constexpr uint32_t Known_Flags = CU_ICONV_FROM_STORED | CU_ICONV_UNCHANGED;

bool passes_unchanged(const cu_iconv_t *p_handle) {
  return p_handle == nullptr || p_handle->descriptor == reinterpret_cast<iconv_t>(-1);
}

char *copy_string(std::string_view text) {
  char *p_copy = static_cast<char *>(std::malloc(text.size() + 1));
  if (p_copy != nullptr) {
    std::memcpy(p_copy, text.data(), text.size());
    p_copy[text.size()] = '\0';
  }
  return p_copy;
}

// Converts `input` through the descriptor into a new malloc'ed string.
int32_t convert(iconv_t descriptor, std::string_view input, char **pp_out) {
  iconv(descriptor, nullptr, nullptr, nullptr, nullptr);  // back to the initial shift state
  size_t capacity = input.size() * 2 + 16;
  char *p_out = static_cast<char *>(std::malloc(capacity));
  if (p_out == nullptr) {
    return CU_RESULT_NO_MEMORY;
  }
  char *p_in = const_cast<char *>(input.data());
  size_t in_left = input.size();
  size_t used = 0;
  bool flushing = false;
  for (;;) {
    char *p_next = p_out + used;
    size_t out_left = capacity - used - 1;  // room for the terminating NUL
    const size_t result = flushing ? iconv(descriptor, nullptr, nullptr, &p_next, &out_left)
                                   : iconv(descriptor, &p_in, &in_left, &p_next, &out_left);
    used = static_cast<size_t>(p_next - p_out);
    if (result != static_cast<size_t>(-1)) {
      if (flushing) {
        break;
      }
      flushing = true;  // the input is consumed; write any closing shift sequence
      continue;
    }
    if (errno != E2BIG) {
      std::free(p_out);
      return CU_RESULT_INVALID_SEQUENCE;  // EILSEQ, or EINVAL for a truncated sequence
    }
    capacity *= 2;
    char *p_bigger = static_cast<char *>(std::realloc(p_out, capacity));
    if (p_bigger == nullptr) {
      std::free(p_out);
      return CU_RESULT_NO_MEMORY;
    }
    p_out = p_bigger;
  }
  p_out[used] = '\0';
  *pp_out = p_out;
  return CU_RESULT_OK;
}

}  // namespace

extern "C" {

int32_t cu_get_locale_info_1(cu_locale_info_t **pp_info) {
  if (pp_info == nullptr) {
    return CU_RESULT_NULL_ARGUMENT;
  }
  const char *p_name = setlocale(LC_CTYPE, nullptr);
  const std::string name = p_name ? p_name : "C";
  const std::string code_set = nl_langinfo(CODESET);
  // One block: the record and both strings, released by one free.
  const size_t size = sizeof(cu_locale_info_t) + name.size() + 1 + code_set.size() + 1;
  char *p_block = static_cast<char *>(std::malloc(size));
  if (p_block == nullptr) {
    *pp_info = nullptr;
    return CU_RESULT_NO_MEMORY;
  }
  char *p_name_copy = p_block + sizeof(cu_locale_info_t);
  char *p_code_set_copy = p_name_copy + name.size() + 1;
  std::memcpy(p_name_copy, name.c_str(), name.size() + 1);
  std::memcpy(p_code_set_copy, code_set.c_str(), code_set.size() + 1);
  auto *p_info = reinterpret_cast<cu_locale_info_t *>(p_block);
  p_info->p_locale_name = p_name_copy;
  p_info->p_code_set = p_code_set_copy;
  *pp_info = p_info;
  return CU_RESULT_OK;
}

void cu_rel_locale_info_1(cu_locale_info_t *p_info) {
  std::free(p_info);
}

int32_t cu_utf8_is_not_modified_1(const cu_locale_info_t *p_info) {
  if (p_info == nullptr) {
    return 0;
  }
  const std::string_view name = p_info->p_locale_name ? p_info->p_locale_name : "";
  const char *p_code_set = p_info->p_code_set ? p_info->p_code_set : "";
  const bool plain_c_locale = name == "C" || name == "POSIX";
  const bool utf8 = strcasecmp(p_code_set, "UTF-8") == 0 || strcasecmp(p_code_set, "UTF8") == 0;
  return (plain_c_locale || utf8) ? 1 : 0;
}

int32_t cu_iconv_open_1(const char *p_code_set, uint32_t flags, cu_iconv_t **pp_handle) {
  if (p_code_set == nullptr || pp_handle == nullptr) {
    return CU_RESULT_NULL_ARGUMENT;
  }
  if ((flags & ~Known_Flags) != 0) {
    return CU_RESULT_BAD_FLAGS;
  }
  auto *p_handle = new (std::nothrow) cu_iconv_t;
  if (p_handle == nullptr) {
    return CU_RESULT_NO_MEMORY;
  }
  if ((flags & CU_ICONV_UNCHANGED) == 0) {
    const bool from_stored = (flags & CU_ICONV_FROM_STORED) != 0;
    p_handle->descriptor = from_stored ? iconv_open(p_code_set, Stored_Code_Set)
                                       : iconv_open(Stored_Code_Set, p_code_set);
    if (p_handle->descriptor == reinterpret_cast<iconv_t>(-1)) {
      const int32_t result = errno == ENOMEM ? CU_RESULT_NO_MEMORY : CU_RESULT_UNSUPPORTED_CODE_SET;
      delete p_handle;
      return result;
    }
  }
  *pp_handle = p_handle;
  return CU_RESULT_OK;
}

int32_t cu_iconv_str_1(cu_iconv_t *p_handle, const char *p_in, char **pp_out) {
  if (p_in == nullptr || pp_out == nullptr) {
    return CU_RESULT_NULL_ARGUMENT;
  }
  *pp_out = nullptr;
  if (passes_unchanged(p_handle)) {
    *pp_out = copy_string(p_in);
    return *pp_out ? CU_RESULT_OK : CU_RESULT_NO_MEMORY;
  }
  try {
    std::lock_guard guard(p_handle->lock);
    return convert(p_handle->descriptor, p_in, pp_out);
  } catch (const std::system_error &) {
    return CU_RESULT_INVALID_SEQUENCE;  // the handle's lock is broken: nothing was converted
  }
}

int32_t cu_iconv_is_unchanged_1(const cu_iconv_t *p_handle) {
  return passes_unchanged(p_handle) ? 1 : 0;
}

int32_t cu_iconv_close_1(cu_iconv_t *p_handle) {
  if (p_handle != nullptr) {
    if (!passes_unchanged(p_handle)) {
      iconv_close(p_handle->descriptor);
    }
    delete p_handle;
  }
  return CU_RESULT_OK;
}

}  // extern "C"
