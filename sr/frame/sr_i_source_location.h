/*
 * sr_i_source_location.h - the place in the source a call was made from,
 * taken as a default argument (`where = sr_i_source_location::current()`),
 * so that error messages and development traces name the raising site
 * without any caller passing __LINE__ by hand.
 *
 * Where the standard library provides std::source_location it is used, as
 * it names the function a lambda lies in ("f()::<lambda()>") rather than
 * "operator()". Some compilers lack the built-in that std::source_location
 * needs (clang 14 with libstdc++ 12 does, which the fuzz build uses); there
 * the compiler's file, line and function built-ins stand in. Both forms are
 * evaluated at the call site, and file names follow -ffile-prefix-map.
 */
#ifndef SR_I_SOURCE_LOCATION_H
#define SR_I_SOURCE_LOCATION_H

#include <version>

#if defined(__cpp_lib_source_location)
#include <source_location>
#endif

struct sr_i_source_location {
#if defined(__cpp_lib_source_location)
  static constexpr sr_i_source_location current(
      std::source_location where = std::source_location::current()) noexcept {
    return sr_i_source_location(where.file_name(), where.line(), where.function_name());
  }
#else
  static constexpr sr_i_source_location current(
      const char *file = __builtin_FILE(), unsigned line = __builtin_LINE(),
      const char *function = __builtin_FUNCTION()) noexcept {
    return sr_i_source_location(file, line, function);
  }
#endif

  constexpr const char *file_name() const noexcept {
    return file_;
  }
  constexpr unsigned line() const noexcept {
    return line_;
  }
  constexpr const char *function_name() const noexcept {
    return function_;
  }

 private:
  constexpr sr_i_source_location(const char *file, unsigned line, const char *function) noexcept
      : file_(file), line_(line), function_(function) {}

  const char *file_;
  unsigned line_;
  const char *function_;
};

#endif /* SR_I_SOURCE_LOCATION_H */
