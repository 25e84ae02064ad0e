/*
 * cu_i_message.h - internal seams of the error-information code of libqv_cu:
 * message formatting with positional inserts and the message catalog
 * lookup. Not installed; used by cu_error.cpp and by white-box tests.
 */
#ifndef CU_I_MESSAGE_H
#define CU_I_MESSAGE_H

#include <cstdarg>
#include <cstdint>
#include <string>

/*
 * Formats a message. The printf conversions of `p_default_text` (positional
 * "%2$d" or sequential "%d") decide how many arguments `arguments` holds and
 * of which type. `p_preferred_text` (a catalog's translation, or null) is
 * used when each of its conversions names an argument the default text has,
 * with the same type; otherwise the default text is used. A default text
 * whose own conversions are unusable ("*" widths, gaps, clashing types) is
 * copied as it stands, reading no argument.
 * Throws std::bad_alloc when memory runs out.
 */
std::string cu_i_format_message(const char *p_preferred_text, const char *p_default_text,
                                va_list arguments);

/*
 * The text of message `message` of set `set` in the catalog `p_catalog`, or
 * null when the catalog or the message cannot be found. Catalogs are opened
 * once per name and NLSPATH value and stay open, so the text lives as long
 * as the process.
 */
const char *cu_i_catalog_text(const char *p_catalog, int32_t set, int32_t message);

#endif /* CU_I_MESSAGE_H */
