/*
 * qv_sr.h - the registry library libqv_sr: named, typed tables shared by the
 * threads of a process and, through files, by processes.
 *
 * Conventions
 *  1. Return codes. Every function returns a signed 32-bit code: 0 for
 *     success, otherwise an SR_E_* code below. The code is also the number
 *     of the message ("2605-<code>") that explains it.
 *  2. Error information. A failing call leaves a message for the calling
 *     thread; a successful exported call clears it. Read it with
 *     cu_get_error_1() and release it with cu_rel_error_1() (qv_cu.h).
 *     Messages come from the catalog "qv_sr.cat" (message set 1) when the C
 *     library finds it through NLSPATH, else from the built-in texts
 *     cu_mesgtbl_qv_sr_set. Threads never see each other's messages.
 *  3. Memory. Everything a call hands back is the caller's and is released
 *     with free() unless the function's contract names another release call.
 *  4. Threads. A tree handle may be used by several threads at once; the
 *     library locks what it touches. Closing a tree while other threads still
 *     use it or its tables is the caller's error.
 *  5. fork(). In a child process forked after the first sr_open_tree_1, every
 *     call that would change a table or the namespace returns SR_E_INTERNAL
 *     at once, without a message and without taking a lock (a thread of the
 *     parent may have held one at the fork); reading calls still work.
 *  6. Tracing is off unless QV_TRACE_LEVELS enables the component "_SRA"
 *     (categories "API", "Errors", "Wherever"; see qv_tr.h). The record
 *     identifiers are listed in docs/tracing.md; the program qv-print-trace
 *     (tools/print-trace.sh) prints a trace file with their names.
 */
#ifndef QV_SR_H
#define QV_SR_H

#include <stdarg.h>
#include <stdint.h>

#include "qv_cu.h"
#include "qv_types.h"

#if defined(__GNUC__)
#define QV_SR_EXPORT __attribute__((visibility("default")))
#else
#define QV_SR_EXPORT
#endif

#ifdef __cplusplus
extern "C" {
#endif

/* ---- Return codes ------------------------------------------------------ */

#define SR_E_SYSTEM_CALL 10          /* a system call failed unexpectedly */
#define SR_E_LIBRARY_CALL 11         /* a companion library call failed */
#define SR_E_NO_MEMORY 12            /* memory could not be allocated */
#define SR_E_TREE_FULL 13            /* the filesystem of the local tree is full */
#define SR_E_TABLE_UNREADABLE 14     /* a table file cannot be read */
#define SR_E_INTERNAL 15             /* internal inconsistency; also any change in a forked child */
#define SR_E_FILESYSTEM_FULL 16      /* a write found the filesystem full */
#define SR_E_INVALID_HANDLE 100      /* a null or unknown tree or table handle */
#define SR_E_NULL_POINTER 101        /* a required pointer argument was null */
#define SR_E_INVALID_PATH 102        /* a registry path is not valid */
#define SR_E_INVALID_MODE 103        /* a create or open mode is not valid */
#define SR_E_NO_COLUMNS 104          /* column names or definitions were expected */
#define SR_E_INVALID_COLUMN 105      /* a column definition or name is not valid */
#define SR_E_DUPLICATE_COLUMN 106    /* a column name was given twice */
#define SR_E_KEY_EXPECTED 107        /* the key column value was expected */
#define SR_E_DUPLICATE_KEY 108       /* the key exists already, or two key columns */
#define SR_E_INVALID_CRITERIA 109    /* a replacement variable in criteria is not valid */
#define SR_E_NO_TABLE 200            /* the table does not exist */
#define SR_E_TABLE_EXISTS 201        /* the table exists already */
#define SR_E_NO_ROW_FOR_KEY 202      /* no row has the key */
#define SR_E_NO_ROW_FOR_INDEX 203    /* no row has the index */
#define SR_E_ROW_DELETED 204         /* the row at the index has been deleted */
#define SR_E_NO_ROWS 205             /* there are no rows to delete */
#define SR_E_ACCESS 206              /* no permission, or a write to a read-only table */
#define SR_E_MOUNT_POINT_EXISTS 207  /* a mount point containing the path exists */
#define SR_E_NO_MOUNT_POINT 208      /* the mount point does not exist */
#define SR_E_UNCOMMITTED 209         /* the call needs a committed table */
#define SR_E_NOT_APPLIED 210         /* the call needs pending updates applied first */
#define SR_E_EXCLUSIVE_MODES 211     /* a table was opened in mutually exclusive modes */
#define SR_E_APPLIED_UNCOMMITTED 212 /* the table has applied but uncommitted updates */
/* A table file whose committed state cannot be rebuilt (each reported with
 * the text of 2605-202): */
#define SR_E_NO_REPLACED_ROW 213  /* a row record replaces no current row record */
#define SR_E_NO_DELETED_ROW 214   /* a deletion record names no current row record */
#define SR_E_NO_COMMIT_RECORD 215 /* no live commit record */

/* The built-in texts of message set 1 of "qv_sr.cat", indexed by message
 * number (not by code: codes 16 and 213 have the last two numbers). */
#define SR_MESSAGE_COUNT 32
QV_SR_EXPORT extern const char *const cu_mesgtbl_qv_sr_set[SR_MESSAGE_COUNT];

/* ---- Column definitions ------------------------------------------------ */

/* A column qualifier: a base value (qualifier & 15) with modifiers OR-ed on. */
typedef enum {
  SR_UNKNOWN_QUALIFIER = 0,
  SR_SYSTEM = 1,
  SR_STANDARD = 2,
  SR_PRIMARY_KEY = 3,
  SR_PRIMARY_KEY_NOCHECK = 4,
  SR_PROTECTED = 16,
  SR_INVISIBLE = 32,
  SR_SET_TO_DEFAULT_WHEN_UNSPECIFIED = 64
} sr_qualifier_t;

/* One field of a structured-data definition. */
typedef struct sr_sd_field_def_struct_t {
  qv_data_type_t type;
  qv_char_ptr_t name;
} sr_sd_field_def_t;

/* The elements of a QV_SD_PTR or QV_SD_PTR_ARRAY column. */
typedef struct sr_sd_def_struct_t {
  uint32_t number_of_fields;
  sr_sd_field_def_t field_def[];
} sr_sd_def_t;

/*
 * A column. Names are 1 to 255 bytes: a letter, then letters, digits and
 * underscores; they are compared byte for byte. `properties` is the
 * application's own and is handed back unchanged. `sd_defn` is required for
 * structured-data columns and ignored for the others. `default_value` points
 * to the default's block for variable-length types (null means empty).
 */
typedef struct sr_column_struct_t {
  qv_char_ptr_t name;
  qv_data_type_t type;
  sr_qualifier_t qualifier;
  int32_t properties;
  sr_sd_def_t *sd_defn;
  qv_value_t default_value;
} sr_column_t;

/* The state of a row in the view a read asked for. */
typedef enum {
  SR_ROW_STATE_COMMITTED = 0,
  SR_ROW_STATE_ADDED = 1,
  SR_ROW_STATE_UPDATED = 2,
  SR_ROW_STATE_DELETED = 3,
  SR_ROW_STATE_NO_ROW = 4
} sr_row_state_t;

/* Kinds and storage of the entries of the older directory calls (see
 * sr_i_get_directory_list_compat). */
typedef enum {
  SR_UNKNOWN_ENTRY = 0,
  SR_TABLE = 1,
  SR_DIRECTORY = 2,
  SR_MOUNT_POINT = 3,
  SR_DIRECTORY_CONTAINER = 4,
  SR_LOCAL_PERSISTENCE_MOUNT_POINT = 5,
  SR_TREE = 6,
  SR_REGISTRY = 7
} sr_entry_t;

typedef enum {
  SR_UNKNOWN_STORAGE = 0,
  SR_PERSISTENT = 1,
  SR_TRANSIENT = 2,
  SR_REMOTE = 3
} sr_storage_t;

typedef struct sr_entry_metadata_struct_t {
  qv_char_ptr_t name;
  sr_entry_t type;
  sr_storage_t storage;
  struct sr_entry_metadata_struct_t *p_table_list;
} sr_entry_metadata_t;

/*
 * Key hashing supplied by a client of a hashed-key table. The hash function
 * receives a pointer to a key value (for a string key the characters, for a
 * resource handle the handle, for a number the number) and returns a bucket
 * number below the bucket count the table was created with. The compare
 * function receives the stored key first and the key looked for second and
 * returns 0 when they are equal.
 */
typedef uint32_t (*sr_hash_function_t)(const void *p_key);
typedef int32_t (*sr_hash_keys_compare_function_t)(const void *p_stored_key, const void *p_key);

/* A tree or table handle. */
typedef void *sr_opaque_handle_t;

/*
 * Modes of sr_create_table_1 and sr_open_table_1 (and their hashed-key
 * forms), bits OR-ed together. A table is implicitly controlled (each
 * changing call applies and commits before it returns) or explicitly
 * controlled (the caller calls sr_apply_1 and sr_commit_1).
 *   create: 0 or SR_MODE_WRITE             writable, implicitly controlled;
 *           SR_MODE_EXPLICIT_CONTROL or
 *           SR_MODE_WRITE_EXPLICIT         writable, explicitly controlled;
 *           the SR_MODE_READ bit changes nothing (a new table is always
 *           writable); any value from 0 to 7 is accepted.
 *   open:   SR_MODE_READ                   read only;
 *           SR_MODE_WRITE                  writable, implicitly controlled;
 *           SR_MODE_WRITE_EXPLICIT         writable, explicitly controlled;
 *           the SR_MODE_READ bit may be added to either writable mode;
 *           0, 4 and any value above 7 are refused (SR_E_INVALID_MODE).
 * The numbers are part of the interface: programs that pass them keep
 * working.
 */
#define SR_MODE_READ 1
#define SR_MODE_WRITE 2
#define SR_MODE_EXPLICIT_CONTROL 4
#define SR_MODE_WRITE_EXPLICIT 6 /* SR_MODE_WRITE | SR_MODE_EXPLICIT_CONTROL */

/* A key hash table of the library's internal interface (opaque here). */
struct sr_hash_table_struct_t;

/* ---- Trees ------------------------------------------------------------- */

/*
 * Opens a tree, the handle every table operation works in, and stores it in
 * *tree_handle. Strings are converted between the process's current locale
 * and the stored form (UTF-8) for the life of the tree; in a UTF-8 locale or
 * the C locale they are stored byte for byte. `number_of_retries` and
 * `timeout` are accepted for compatibility and not used.
 * Returns 0; SR_E_INVALID_HANDLE when tree_handle is null; SR_E_NO_MEMORY;
 * SR_E_LIBRARY_CALL when the locale's code set cannot be converted;
 * SR_E_SYSTEM_CALL when a process lock fails.
 */
QV_SR_EXPORT int32_t sr_open_tree_1(sr_opaque_handle_t *tree_handle, uint32_t number_of_retries,
                                    uint32_t timeout);

/*
 * Closes a tree: every table and mount point of it is closed, whatever
 * handles the caller still holds, and the handle becomes invalid.
 * Returns 0; SR_E_INVALID_HANDLE for a null handle or one that is not an open
 * tree (for example, closed already); SR_E_SYSTEM_CALL when a lock fails.
 */
QV_SR_EXPORT int32_t sr_close_tree_1(sr_opaque_handle_t tree_handle);

/* ---- Registry paths ------------------------------------------------------
 *
 * A table (and a mount point) is named by a registry path such as
 * "/example/services":
 *  - 1 to 255 bytes, each a letter or a digit (as isalnum() judges it in the
 *    current C locale: ASCII only in the C locale and in UTF-8 locales), "_"
 *    or "/"; no "//". Anything else (a blank, ".", "-", ",", a byte of a
 *    UTF-8 character) makes the call return SR_E_INVALID_PATH.
 *  - The leading "/" is optional and significant: "/a" and "a" are two
 *    different tables, and a mount point "/a" covers "/a/t" but not "a/t".
 *    A trailing "/" is accepted and is part of the name ("/a/" is not "/a");
 *    a lone "/" is a valid path.
 *  - Paths are compared byte for byte (case matters); nothing is
 *    normalised.
 *  - A mount point covers the paths that continue it by whole components:
 *    "/a" covers "/a/t" and "/a/b/t", not "/ab/t" nor "/a" itself. Give a
 *    mount point without a trailing "/": with one it covers no path.
 */

/* ---- Tables ------------------------------------------------------------ */

/*
 * Creates the table `p_registry_path` with the `array_count` columns of
 * `p_columns` and stores a handle in *p_result_table_handle (close it with
 * sr_close_table_1). Exactly one column is the key (base qualifier
 * SR_PRIMARY_KEY or SR_PRIMARY_KEY_NOCHECK, of a numeric type, QV_CHAR_PTR
 * or QV_RSRC_HANDLE_PTR); it becomes column 0 of the table. The caller's
 * array is not changed. `mode` (see SR_MODE_READ): SR_MODE_EXPLICIT_CONTROL
 * makes the table explicitly controlled (the caller applies and commits);
 * without it every change is applied and committed before its call returns.
 * The table is always open for writing. A table whose key is a resource
 * handle gets a key hash table.
 *
 * Keys without a hash table: a table made by this call whose key is a
 * number or a string (it has no key hash table) checks a new key under
 * SR_PRIMARY_KEY by comparing it with the rows in fixed-index order, and a
 * new row takes the lowest free place. Once a row before the last live row
 * has been deleted and the deletion committed, the new row lands in that
 * place, the scan meets it, and every sr_add_row_1 is refused with
 * SR_E_DUPLICATE_KEY, whatever the key, for as long as a live row follows
 * the freed place. A table whose rows are ever deleted should have a key
 * hash table (sr_create_hashed_key_table_1, which also makes lookups by key
 * fast), or an SR_PRIMARY_KEY_NOCHECK key, which checks nothing: the caller
 * then finds rows sharing a key with sr_get_duplicate_rows_1.
 * Returns 0; SR_E_INVALID_HANDLE; SR_E_NULL_POINTER; SR_E_INVALID_MODE;
 * SR_E_INVALID_PATH; SR_E_NO_COLUMNS; SR_E_INVALID_COLUMN (a name, type,
 * qualifier, missing structured-data definition or key type); SR_E_KEY_EXPECTED
 * (no key); SR_E_DUPLICATE_KEY (two keys); SR_E_DUPLICATE_COLUMN;
 * SR_E_TABLE_EXISTS; SR_E_LIBRARY_CALL (a default value cannot be encoded);
 * SR_E_NO_MEMORY; SR_E_INTERNAL in a forked child. Below a mount point the
 * table is persistent: its file is written and flushed before the call
 * returns (SR_E_SYSTEM_CALL, SR_E_FILESYSTEM_FULL, SR_E_ACCESS when that fails).
 */
QV_SR_EXPORT int32_t sr_create_table_1(sr_opaque_handle_t tree_handle, const char *p_registry_path,
                                       sr_column_t *p_columns, uint32_t array_count, int32_t mode,
                                       sr_opaque_handle_t *p_result_table_handle);

/*
 * As sr_create_table_1, with a key hash table of `total_hash_buckets`
 * buckets, hashed by `p_hash_function` and compared by `p_compare_function`.
 * SR_E_NULL_POINTER when the bucket count is 0 or a function is null.
 */
QV_SR_EXPORT int32_t sr_create_hashed_key_table_1(
    sr_opaque_handle_t tree_handle, const char *p_registry_path, sr_column_t *p_columns,
    uint32_t array_count, int32_t mode, uint32_t total_hash_buckets,
    sr_hash_function_t p_hash_function, sr_hash_keys_compare_function_t p_compare_function,
    sr_opaque_handle_t *p_result_table_handle);

/*
 * Opens the table `p_registry_path` of the tree. Every opening of a table
 * in a tree shares one object. `mode` (see SR_MODE_READ): SR_MODE_READ read
 * only; SR_MODE_WRITE writable and implicitly controlled;
 * SR_MODE_WRITE_EXPLICIT writable and explicitly controlled. The
 * first writable opening decides the control kind; a writable opening of
 * the other kind while it is open is refused. A read-only table opened for
 * writing becomes writable for every handle.
 * Returns 0; SR_E_INVALID_HANDLE; SR_E_NULL_POINTER; SR_E_INVALID_MODE;
 * SR_E_INVALID_PATH; SR_E_NO_TABLE; SR_E_EXCLUSIVE_MODES. Below a mount
 * point a table not yet in memory is loaded from its file:
 * SR_E_TABLE_UNREADABLE when the file cannot be read as a table,
 * SR_E_SYSTEM_CALL or SR_E_ACCESS when it cannot be opened.
 */
QV_SR_EXPORT int32_t sr_open_table_1(sr_opaque_handle_t tree_handle, const char *p_registry_path,
                                     int32_t mode, sr_opaque_handle_t *p_result_table_handle);

/* As sr_open_table_1; the hash settings (checked as for
 * sr_create_hashed_key_table_1) serve a table loaded from its file, while a
 * table already in memory keeps its own. */
QV_SR_EXPORT int32_t sr_open_hashed_key_table_1(sr_opaque_handle_t tree_handle,
                                                const char *p_registry_path, int32_t mode,
                                                uint32_t total_hash_buckets,
                                                sr_hash_function_t p_hash_function,
                                                sr_hash_keys_compare_function_t p_compare_function,
                                                sr_opaque_handle_t *p_result_table_handle);

/*
 * Gives a handle back. A transient table keeps its rows in the tree after
 * its last handle is closed and can be opened again; a result table without
 * a name is freed at once. Returns 0 or SR_E_INVALID_HANDLE.
 */
QV_SR_EXPORT int32_t sr_close_table_1(sr_opaque_handle_t table_handle);

/* ---- Table metadata ---------------------------------------------------- */

/* A description of an open table, allocated for the caller; every pointer
 * in it is a separate allocation released by sr_free_table_metadata_1. */
typedef struct sr_table_metadata_struct_t {
  char *name;              /* registry path, or "" for an unnamed table */
  uint32_t number_of_rows; /* applied rows when uncommitted updates are visible, else committed */
  uint32_t number_of_columns; /* entries of column_definitions, or the table's column count */
  uint64_t table_change_counter;
  int32_t properties;              /* always 0 */
  sr_column_t *column_definitions; /* null unless asked for */
} sr_table_metadata_t;

/*
 * Describes a table. `all_metadata` 0: no column definitions; -1: all
 * columns; any other value: the columns not qualified SR_INVISIBLE, in
 * order. Each column copy has its own name, structured-data definition and,
 * for a variable-length type, its decoded default value.
 * Returns 0; SR_E_INVALID_HANDLE; SR_E_NULL_POINTER; SR_E_NO_MEMORY;
 * SR_E_LIBRARY_CALL when a default value cannot be decoded.
 */
QV_SR_EXPORT int32_t sr_get_table_metadata_1(sr_opaque_handle_t table_handle, int32_t all_metadata,
                                             sr_table_metadata_t **p_p_metadata);

/* Releases a description; SR_E_NULL_POINTER for null. Freeing one twice is
 * the caller's error. */
QV_SR_EXPORT int32_t sr_free_table_metadata_1(sr_table_metadata_t *p_metadata);

/* ---- Schema changes ------------------------------------------------------ */

/*
 * Adding, deleting and renaming columns and changing a default rebuild the
 * table while handles stay open: a new image with the new columns and every
 * committed row is built, made durable, and then takes the place of the old
 * one, so that every handle on the table sees the new schema when the call
 * returns and a failure leaves the table (and its file) exactly as it was.
 * A persistent table's file is written anew beside the old one and renamed
 * over it; another process reading it sees the old table or the new one.
 * The table must be open for writing (SR_E_ACCESS) and fully committed:
 * nothing pending, nothing applied and not committed (SR_E_UNCOMMITTED).
 * Readers of the table wait while it is rebuilt. Afterwards the rows lie in
 * their packed order, so fixed row indexes taken before may name other rows;
 * the change counter is one higher (for a persistent table, as the commit of
 * the new file sets it). Invisible columns are kept through every change but
 * cannot be named by one. Each call also returns SR_E_INVALID_HANDLE for a
 * null handle, SR_E_NO_MEMORY, SR_E_INTERNAL in a forked child, and for a
 * persistent table the codes of writing its file (SR_E_SYSTEM_CALL,
 * SR_E_FILESYSTEM_FULL, SR_E_ACCESS).
 */

/*
 * Adds `array_count` columns behind the existing ones; every row takes
 * their default values. The new definitions are checked as at creation.
 * Returns 0; SR_E_NULL_POINTER; SR_E_NO_COLUMNS for a count of 0;
 * SR_E_INVALID_COLUMN; SR_E_DUPLICATE_COLUMN (a name the table has, or one
 * given twice); SR_E_DUPLICATE_KEY (a second key column); SR_E_LIBRARY_CALL
 * (a default cannot be encoded); and the codes above.
 */
QV_SR_EXPORT int32_t sr_add_columns_1(sr_opaque_handle_t table_handle, sr_column_t *columns,
                                      uint32_t array_count);

/*
 * Deletes the named columns and their values. The key column cannot be
 * deleted, nor an invisible one; at least the key remains. Returns 0;
 * SR_E_NULL_POINTER for a null array; SR_E_NO_COLUMNS for a count of 0;
 * SR_E_INVALID_COLUMN for an unknown, key or invisible column or more names
 * than the table has columns besides its key; and the codes above.
 */
QV_SR_EXPORT int32_t sr_delete_columns_1(sr_opaque_handle_t table_handle,
                                         const char *const *column_names, uint32_t array_count);

/*
 * Renames the visible column `column_name` to `new_name`. Returns 0;
 * SR_E_NULL_POINTER; SR_E_INVALID_COLUMN (no such visible column, or a new
 * name that is not valid); SR_E_DUPLICATE_COLUMN when the table has a
 * column of that name already; and the codes above.
 */
QV_SR_EXPORT int32_t sr_change_column_name_1(sr_opaque_handle_t table_handle,
                                             const char *column_name, const char *new_name);

/*
 * Gives the visible column `column_name` the default `new_value` (copied;
 * for a variable-length type a pointer to the caller's value). Rows already
 * in the table keep their values; rows added later take the new default.
 * Returns 0; SR_E_NULL_POINTER; SR_E_INVALID_COLUMN; SR_E_LIBRARY_CALL (the
 * value cannot be encoded); and the codes above.
 */
QV_SR_EXPORT int32_t sr_change_default_value_1(sr_opaque_handle_t table_handle,
                                               const char *column_name, qv_value_t new_value);

/*
 * Replaces the default value of any column (invisible ones too) in this
 * process's memory only: no row changes, nothing is written, and no open
 * mode is required. Other trees and processes keep the stored default; the
 * overlay lasts while the table stays open here, except that a later
 * rewrite of a persistent table's file (a large apply, or a schema change)
 * writes the column definitions as they then are. A variable-length default
 * is encoded in the room of the old one: SR_E_NO_ROWS when it needs more
 * (an equal or shorter one fits). Returns 0; SR_E_INVALID_HANDLE;
 * SR_E_NULL_POINTER for a null name; SR_E_INVALID_COLUMN for no such column;
 * SR_E_NO_ROWS; SR_E_LIBRARY_CALL; SR_E_NO_MEMORY; SR_E_INTERNAL in a forked
 * child.
 */
QV_SR_EXPORT int32_t sr_overlay_memory_default_value_1(sr_opaque_handle_t table_handle,
                                                       const char *p_column_name,
                                                       qv_value_t new_default_value);

/*
 * Replaces the qualifier of a column in memory only, as the default
 * overlay does: both the column's present qualifier and `new_qualifier`
 * must have the base SR_STANDARD, so only the flags SR_PROTECTED,
 * SR_INVISIBLE and SR_SET_TO_DEFAULT_WHEN_UNSPECIFIED change. Returns 0;
 * SR_E_INVALID_HANDLE; SR_E_NULL_POINTER; SR_E_INVALID_COLUMN (no such
 * column, a key or system column, or a base other than SR_STANDARD);
 * SR_E_INTERNAL in a forked child.
 */
QV_SR_EXPORT int32_t sr_overlay_memory_column_qualifier_1(sr_opaque_handle_t table_handle,
                                                          const char *p_column_name,
                                                          sr_qualifier_t new_qualifier);

/* ---- Mount points ------------------------------------------------------ */

/*
 * Maps the registry path prefix `p_registry_path` onto the directory
 * `p_filesystem_path`, creating it and its parents (mode 0755) when missing:
 * from then on a table created below the prefix is persistent, one file in
 * that directory named by the rest of its path with "," for "/" (mount /a on
 * /var/reg, and /a/b/c/t is the file /var/reg/b,c,t). Mount points may nest
 * (mounting /a while /a/b is mounted is allowed); a path then belongs to the
 * deepest mount point that contains it. `create` is ignored: directories are
 * always created. Mount points last until unmounted or the tree is closed.
 * Returns 0; SR_E_INVALID_HANDLE; SR_E_NULL_POINTER for a null directory;
 * SR_E_INVALID_PATH; SR_E_MOUNT_POINT_EXISTS when the path is already below
 * a mount point or mounted; SR_E_TABLE_EXISTS when a table has exactly this
 * path; SR_E_FILESYSTEM_FULL or SR_E_SYSTEM_CALL ("mkdir") when the
 * directory cannot be made (one already made is kept); SR_E_NO_MEMORY;
 * SR_E_INTERNAL in a forked child.
 */
QV_SR_EXPORT int32_t sr_mount_local_tree_1(sr_opaque_handle_t tree_handle,
                                           const char *p_registry_path,
                                           const char *p_filesystem_path, int32_t create);

/*
 * Removes the mount point `p_registry_path` (as it was given to the mount
 * call). Tables already open below it keep their files; a later create or
 * open of such a path makes a transient table. Returns 0;
 * SR_E_INVALID_HANDLE; SR_E_NO_MOUNT_POINT when the tree has no mount point
 * at all (whatever the path) or not this one; SR_E_INVALID_PATH.
 */
QV_SR_EXPORT int32_t sr_unmount_local_tree_1(sr_opaque_handle_t tree_handle,
                                             const char *p_registry_path);

/* ---- Application metadata --------------------------------------------- */

/*
 * A table carries one counted byte string of the application's own, changed
 * like the table's rows: a set is seen by readers of uncommitted updates at
 * once and by everyone after sr_commit_1; sr_abort_1 brings back the value
 * last committed (or none). On an implicitly controlled table a set is
 * committed before the call returns.
 */

/*
 * Stores in *p_p_application_metadata a copy of the table's application
 * metadata: the committed value, or the newest value when the table was
 * opened with uncommitted updates visible. The copy is the caller's, one
 * block freed with free(). *p_p_application_metadata is unchanged on failure.
 * Returns 0; SR_E_INVALID_HANDLE for a null table handle; SR_E_NULL_POINTER
 * for a null p_p_application_metadata; SR_E_NO_ROW_FOR_KEY when the table
 * has no application metadata in that view (never set, or set and not yet
 * committed); SR_E_NO_MEMORY; SR_E_SYSTEM_CALL when the table lock fails.
 */
QV_SR_EXPORT int32_t sr_get_application_metadata_1(sr_opaque_handle_t table_handle,
                                                   qv_binary_t **p_p_application_metadata);

/*
 * Sets the table's application metadata to a copy of the `length` bytes of
 * *p_application_metadata, replacing any earlier value; the caller keeps its
 * block. Allowed while the table has applied but uncommitted updates.
 * Returns 0; SR_E_INVALID_HANDLE for a null table handle; SR_E_NULL_POINTER
 * for a null p_application_metadata; SR_E_ACCESS when the table was opened
 * for reading only; SR_E_NO_MEMORY (the table is unchanged);
 * SR_E_SYSTEM_CALL when the table lock fails; SR_E_INTERNAL in a forked child.
 */
QV_SR_EXPORT int32_t sr_set_application_metadata_1(sr_opaque_handle_t table_handle,
                                                   const qv_binary_t *p_application_metadata);

/* ---- Rows ---------------------------------------------------------------
 *
 * A row is named by its packed index (its place, from 0, among the rows of
 * the applied view; it moves as rows come and go), by its fixed index (its
 * position in the table's row index, stable while the row lives) or by its
 * key (the value of column 0). A change is pending until sr_apply_1 and
 * sr_commit_1; on an implicitly controlled table each successful change is
 * applied and committed before the call returns (and, when the apply fails,
 * every pending change of the table is aborted).
 *
 * Readers see the committed view, or the applied view (pending changes
 * included) when the table was opened with uncommitted updates visible or
 * the call's `uncommitted_updates_visible` is non-zero. A variable-length
 * value read is one new block that the caller frees with free().
 *
 * Every changing call below returns SR_E_INTERNAL at once in a forked child,
 * SR_E_INVALID_HANDLE for a null table handle and SR_E_ACCESS on a table
 * opened for reading; every call may return SR_E_SYSTEM_CALL when the table
 * lock fails and SR_E_NO_MEMORY.
 */

/*
 * Adds a row: the `total_values` columns named in p_column_names take the
 * values p_p_fields points at (a null string is stored as "", a null
 * resource handle as the invalid handle); the others take their defaults.
 * Returns 0; SR_E_APPLIED_UNCOMMITTED; SR_E_KEY_EXPECTED when the key column
 * is not named or its value pointer is null; SR_E_NO_COLUMNS when a name is
 * unknown or given twice; SR_E_DUPLICATE_KEY under SR_PRIMARY_KEY (also for
 * a new key on a table without a key hash table after a deletion: see
 * sr_create_table_1);
 * SR_E_LIBRARY_CALL when a value cannot be encoded. The table is unchanged
 * after a failure.
 */
QV_SR_EXPORT int32_t sr_add_row_1(sr_opaque_handle_t table_handle,
                                  const char *const *p_column_names, qv_value_t *const *p_p_fields,
                                  uint32_t total_values);

/*
 * Read one value (field) or several (fields, `array_count` names and result
 * pointers) of one row. The `_and_visibility` forms also store the row's
 * state in *p_row_state when it is not null. Returns 0;
 * SR_E_NO_ROW_FOR_INDEX for an index out of range (a negative one too);
 * SR_E_INVALID_COLUMN for an unknown column name (values read before it stay
 * filled); SR_E_ROW_DELETED when the row has no record in the view read;
 * SR_E_NO_ROW_FOR_KEY when no row has the key; SR_E_LIBRARY_CALL when a
 * value cannot be decoded.
 */
QV_SR_EXPORT int32_t sr_get_field_by_index_1(sr_opaque_handle_t table_handle, int32_t row_index,
                                             const char *column_name, qv_value_t *result);
QV_SR_EXPORT int32_t sr_get_field_by_index_and_visibility_1(
    sr_opaque_handle_t table_handle, int32_t row_index, const char *column_name, qv_value_t *result,
    uint32_t uncommitted_updates_visible, sr_row_state_t *p_row_state);
QV_SR_EXPORT int32_t sr_get_field_by_fixed_index_and_visibility_1(
    sr_opaque_handle_t table_handle, int32_t fixed_row_index, const char *column_name,
    qv_value_t *result, uint32_t uncommitted_updates_visible, sr_row_state_t *p_row_state);
QV_SR_EXPORT int32_t sr_get_field_by_key_1(sr_opaque_handle_t table_handle, qv_value_t row_key,
                                           const char *column_name, qv_value_t *result);
QV_SR_EXPORT int32_t sr_get_field_by_key_and_visibility_1(
    sr_opaque_handle_t table_handle, qv_value_t row_key, const char *column_name,
    qv_value_t *result, uint32_t uncommitted_updates_visible, sr_row_state_t *p_row_state);
QV_SR_EXPORT int32_t sr_get_fields_by_index_1(sr_opaque_handle_t table_handle, int32_t row_index,
                                              const char *const *column_names,
                                              qv_value_t *const *result, uint32_t array_count);
QV_SR_EXPORT int32_t sr_get_fields_by_index_and_visibility_1(
    sr_opaque_handle_t table_handle, int32_t row_index, const char *const *column_names,
    qv_value_t *const *result, uint32_t array_count, uint32_t uncommitted_updates_visible,
    sr_row_state_t *p_row_state);
QV_SR_EXPORT int32_t sr_get_fields_by_fixed_index_and_visibility_1(
    sr_opaque_handle_t table_handle, int32_t fixed_row_index, const char *const *column_names,
    qv_value_t *const *result, uint32_t array_count, uint32_t uncommitted_updates_visible,
    sr_row_state_t *p_row_state);
QV_SR_EXPORT int32_t sr_get_fields_by_key_1(sr_opaque_handle_t table_handle, qv_value_t row_key,
                                            const char *const *column_names,
                                            qv_value_t *const *result, uint32_t array_count);
QV_SR_EXPORT int32_t sr_get_fields_by_key_and_visibility_1(
    sr_opaque_handle_t table_handle, qv_value_t row_key, const char *const *column_names,
    qv_value_t *const *result, uint32_t array_count, uint32_t uncommitted_updates_visible,
    sr_row_state_t *p_row_state);

/* Stores the fixed index of the row holding `key_value` (deleted rows of
 * the applied view included). Returns 0; SR_E_NULL_POINTER;
 * SR_E_NO_ROW_FOR_KEY. */
QV_SR_EXPORT int32_t sr_get_fixed_row_index_for_key_1(sr_opaque_handle_t table_handle,
                                                      qv_value_t key_value,
                                                      uint32_t *p_fixed_row_index);

/*
 * Set one value (field) or several (fields) of one row as a pending change.
 * Columns not named keep their values, except those qualified
 * SR_SET_TO_DEFAULT_WHEN_UNSPECIFIED, which return to their defaults.
 * Setting the key column does not move the row in the key hash table.
 * Returns 0; SR_E_APPLIED_UNCOMMITTED; SR_E_NO_ROW_FOR_INDEX;
 * SR_E_NO_ROW_FOR_KEY; SR_E_ROW_DELETED; SR_E_INVALID_COLUMN for a protected
 * column, or a name unknown or given twice; SR_E_LIBRARY_CALL.
 */
QV_SR_EXPORT int32_t sr_set_field_by_index_1(sr_opaque_handle_t table_handle, int32_t row_index,
                                             const char *column_name, const qv_value_t *new_field);
QV_SR_EXPORT int32_t sr_set_field_by_fixed_index_1(sr_opaque_handle_t table_handle,
                                                   int32_t fixed_row_index, const char *column_name,
                                                   const qv_value_t *new_field);
QV_SR_EXPORT int32_t sr_set_field_by_key_1(sr_opaque_handle_t table_handle, qv_value_t row_key,
                                           const char *column_name, const qv_value_t *new_field);
QV_SR_EXPORT int32_t sr_set_fields_by_index_1(sr_opaque_handle_t table_handle, int32_t row_index,
                                              const char *const *column_names,
                                              qv_value_t *const *new_fields, uint32_t array_count);
QV_SR_EXPORT int32_t sr_set_fields_by_fixed_index_1(sr_opaque_handle_t table_handle,
                                                    int32_t fixed_row_index,
                                                    const char *const *column_names,
                                                    qv_value_t *const *new_fields,
                                                    uint32_t array_count);
QV_SR_EXPORT int32_t sr_set_fields_by_key_1(sr_opaque_handle_t table_handle, qv_value_t row_key,
                                            const char *const *column_names,
                                            qv_value_t *const *new_values, uint32_t array_count);

/*
 * Deletes the row at packed index `row_index` from the applied view; its
 * committed version stays readable in the committed view until commit.
 * Returns 0; SR_E_NO_ROW_FOR_INDEX; SR_E_ROW_DELETED when the row at that
 * packed index is deleted already.
 */
QV_SR_EXPORT int32_t sr_delete_row_by_index_1(sr_opaque_handle_t table_handle, uint32_t row_index);

/*
 * Deletes every row of the applied view (null `selection_criteria`), or the
 * rows the criteria select. The criteria are an expression over the
 * table's column names that may hold replacement variables, each filled
 * from the further arguments in order: $i int32_t, $l int64_t, $ui uint32_t,
 * $ul uint64_t, $f and $d double, $s const char *, $b const qv_binary_t *,
 * $rh const qv_resource_handle_t *. Returns 0 (also when no row matches);
 * SR_E_APPLIED_UNCOMMITTED; SR_E_NO_ROWS when the applied view has no row;
 * SR_E_INVALID_CRITERIA for an unknown replacement variable;
 * SR_E_LIBRARY_CALL when the criteria do not compile or cannot be
 * evaluated (rows deleted before the failure stay deleted, pending);
 * SR_E_INTERNAL for criteria on a table outside a tree.
 */
QV_SR_EXPORT int32_t sr_delete_rows_1(sr_opaque_handle_t table_handle,
                                      const char *selection_criteria, ...);

/* ---- Queries --------------------------------------------------------------- */

/*
 * Copies the rows that `selection_string` selects into a new table and
 * stores its handle in `*result`. The criteria are an expression over the
 * column names, with replacement variables filled from the further
 * arguments as for sr_delete_rows_1; null selects every row. The rows are
 * those of the view the table's own setting shows (the applied view when
 * SR_UNCOMMITTED_UPDATES_VISIBLE was set as the table was made, else the
 * committed view); the criteria are judged on that same record.
 *
 * The new table is unnamed and memory-only, belongs to the tree, and is
 * open for writing under explicit control (SR_MODE_WRITE_EXPLICIT). Its
 * columns: with a count of 0 every column of the source in order; otherwise
 * the key column first, then each named column in the order given (the key
 * named again is not repeated; any other column named twice is there
 * twice). Definitions, qualifiers, defaults and structured-data definitions
 * are carried; a hashed source's hash functions and bucket count are kept.
 * Every row is committed, and its change counter is the source's plus 1.
 * Close it with sr_close_table_1; closing the tree closes it too.
 *
 * Returns 0 (also when no row matches: the table is empty);
 * SR_E_INVALID_HANDLE; SR_E_NULL_POINTER for a null `result`;
 * SR_E_NO_COLUMNS for a count with a null name array; SR_E_INVALID_COLUMN
 * for an unknown name; SR_E_INVALID_CRITERIA for an unknown replacement
 * variable; SR_E_LIBRARY_CALL when the criteria do not compile or cannot be
 * evaluated; SR_E_NO_MEMORY. On failure nothing is made and the source is
 * unchanged. It may be called in a forked child.
 */
QV_SR_EXPORT int32_t sr_select_1(sr_opaque_handle_t table_handle, const char *const *column_names,
                                 uint32_t array_count, sr_opaque_handle_t *result,
                                 const char *selection_string, ...);

/*
 * Stores in `*p_p_selected_rows_fixed_index` a malloc'ed array of the fixed
 * indexes of the rows that `p_selection_criteria` (a format as for
 * sr_delete_rows_1, its values in `ap`; null selects every row) selects, in
 * fixed-index order, and their number in `*p_total_selected_rows`. The rows
 * are those of the applied view when `uncommitted_updates_visible` is not 0
 * or the table's own setting says so, else of the committed view. Criteria
 * are always judged on a row's applied values: in the committed view a
 * changed row is judged by its pending values, and a row deleted in the
 * applied view but still committed does not match. The caller frees the
 * array with free; it is returned also when the count is 0.
 *
 * Returns 0; SR_E_INVALID_HANDLE; SR_E_NULL_POINTER for a null result
 * pointer; SR_E_INVALID_CRITERIA; SR_E_LIBRARY_CALL; SR_E_NO_MEMORY. It may
 * be called in a forked child.
 */
QV_SR_EXPORT int32_t sr_get_selected_rows_v_1(sr_opaque_handle_t table_handle,
                                              const char *p_selection_criteria, va_list ap,
                                              uint32_t uncommitted_updates_visible,
                                              uint32_t *p_total_selected_rows,
                                              uint32_t **p_p_selected_rows_fixed_index);

/*
 * The rows with pending changes, as fixed indexes in a malloc'ed array the
 * caller frees: the added and updated rows in the order they were first
 * changed, then the deleted rows. `*p_updated_rows_count` counts the added
 * and updated rows only; the deleted ones follow beyond the count. With
 * nothing pending the array is null and the count 0; with only deletions
 * pending the count is 0 and the array holds the deleted rows. Returns 0;
 * SR_E_INVALID_HANDLE; SR_E_NULL_POINTER; SR_E_NO_MEMORY.
 */
QV_SR_EXPORT int32_t sr_get_updated_rows_1(sr_opaque_handle_t table_handle,
                                           uint32_t *p_updated_rows_count,
                                           uint32_t **p_p_updated_rows_fixed_indices);

/*
 * The rows whose key equals `key_value` (several only where the key is
 * qualified SR_PRIMARY_KEY_NOCHECK), as fixed indexes in a malloc'ed array
 * the caller frees, with their number. Only rows of the view that
 * `uncommitted_updates_visible` chooses count (the applied view when not
 * 0); the table's own setting is not consulted. A hashed table lists them
 * most recently added first, another in fixed-index order. Returns 0;
 * SR_E_INVALID_HANDLE; SR_E_NULL_POINTER; SR_E_NO_ROW_FOR_KEY (with the
 * key and table in the message) when no row has the key; SR_E_NO_MEMORY.
 */
QV_SR_EXPORT int32_t sr_get_duplicate_rows_1(sr_opaque_handle_t table_handle, qv_value_t key_value,
                                             uint32_t *p_duplicate_rows_count,
                                             uint32_t **p_p_duplicate_rows_fixed_indices,
                                             uint32_t uncommitted_updates_visible);

/* ---- Transactions -------------------------------------------------------- */

/*
 * Applies the pending changes: readers of uncommitted updates see them, and
 * the table refuses further changes until sr_commit_1 or sr_abort_1. The
 * applied state carries `change_counter`, or the committed counter plus 1
 * when it is 0 or the table is implicitly controlled. Applying with nothing
 * pending is allowed. Returns 0; SR_E_APPLIED_UNCOMMITTED when changes are
 * applied already.
 */
QV_SR_EXPORT int32_t sr_apply_1(sr_opaque_handle_t table_handle, uint64_t change_counter);

/* Makes the applied changes the committed state. Returns 0 (also with
 * nothing applied and nothing pending); SR_E_NOT_APPLIED when changes are
 * pending but not applied. */
QV_SR_EXPORT int32_t sr_commit_1(sr_opaque_handle_t table_handle);

/* Throws away every pending and applied change. Returns 0. */
QV_SR_EXPORT int32_t sr_abort_1(sr_opaque_handle_t table_handle);

/* ---- Copying, moving and deleting tables ----------------------------------- */

/*
 * Copies a table to the path `p_target_table_name`, in memory or below a
 * mount point, whichever kind of table the source is. The copy holds the
 * source's rows as uncommitted-updates readers see them (pending changes
 * included), its columns, key hash functions, application metadata and
 * change counter; the source is not changed. A target that exists is
 * replaced only with `overwrite` non-zero (SR_E_TABLE_EXISTS otherwise; an
 * empty target file counts as no table).
 *
 * A persistent target is written as "<file>.rewrite", flushed, and renamed
 * over the target file, the directory flushed: readers in any process find
 * the old table or the new one, and a copy reported done survives a power
 * cut. Copies into one mount directory are serialised across processes by
 * the directory's ",Lock" file, and a writer of the target (another process
 * with the table open for writing) is waited for. A target that another
 * process is creating at that moment is left to it: the copy gives
 * SR_E_TABLE_EXISTS, with or without `overwrite`. A target open in this
 * tree is read again from its new file: its handles see the new table and
 * their later changes go to the new file; it must have nothing pending or
 * applied (SR_E_UNCOMMITTED). A transient target open in this tree is
 * replaced; its handles keep the old table, detached from the tree.
 *
 * Copying a table onto its own path does nothing with `overwrite`, and
 * gives SR_E_TABLE_EXISTS without it. Returns 0; SR_E_INVALID_HANDLE;
 * SR_E_INVALID_PATH; SR_E_TABLE_EXISTS; SR_E_UNCOMMITTED; SR_E_NO_MEMORY;
 * SR_E_INTERNAL in a forked child; for files, SR_E_NO_TABLE (the source
 * file is missing), SR_E_ACCESS, SR_E_FILESYSTEM_FULL, SR_E_SYSTEM_CALL. On
 * failure the target and the source are as they were, with one exception:
 * when only the flush of the directory failed after the new file took the
 * target's name (or a moved source file was removed), the copy or move is
 * in place, an open target shows it, and the code says that it may not
 * survive a power cut; a move through a handle then leaves its source too.
 */
QV_SR_EXPORT int32_t sr_copy_table_by_handle_1(sr_opaque_handle_t table_handle,
                                               const char *p_target_table_name, int32_t overwrite);

/*
 * As sr_copy_table_by_handle_1, the source named by `p_source_table_name`
 * in the tree: an open table, or below a mount point a table file no one
 * has open here (copied byte for byte). SR_E_NO_TABLE when there is no such
 * table.
 */
QV_SR_EXPORT int32_t sr_copy_table_by_name_1(sr_opaque_handle_t tree_handle,
                                             const char *p_source_table_name,
                                             const char *p_target_table_name, int32_t overwrite);

/*
 * Moves a table to `p_target_table_name`: as a copy, after which the source
 * is gone from its path (and its file from the disk). A table moved into
 * memory is the same table object under its new name, rows and handles
 * included, and no longer refers to any file. A table file moves to another
 * path of its mount directory by one rename, so a crash leaves it at one of
 * the two paths: when it is open here, the same table object goes on under
 * the new path, handles, pending changes and file lock included (a rewrite
 * applied and not committed, or a target open here, make it a copy and a
 * removal instead). Handles on a table moved to disk otherwise keep
 * working on the detached table in memory. Returns as
 * sr_copy_table_by_handle_1.
 */
QV_SR_EXPORT int32_t sr_move_table_by_handle_1(sr_opaque_handle_t table_handle,
                                               const char *p_target_table_name, int32_t overwrite);

/* As sr_move_table_by_handle_1, the source named by path, as for
 * sr_copy_table_by_name_1. A table file no one has open here moves by one
 * rename, waiting for a writer of it in another process; onto another file
 * system, where no rename reaches, it is copied and its file then removed
 * (a failure to remove it is returned, the table then at both paths). */
QV_SR_EXPORT int32_t sr_move_table_by_name_1(sr_opaque_handle_t tree_handle,
                                             const char *p_source_table_name,
                                             const char *p_target_table_name, int32_t overwrite);

/*
 * Deletes the table at `p_registry_path`: the path is free at once. Handles
 * still open on it keep working on the table, now outside the tree, until
 * they are closed. Below a mount point its file (and any side file) is
 * removed whether or not the table is open, durably. Returns 0;
 * SR_E_INVALID_HANDLE; SR_E_INVALID_PATH; SR_E_NO_TABLE when there is no
 * such table (or file); SR_E_ACCESS, SR_E_FILESYSTEM_FULL, SR_E_SYSTEM_CALL
 * when the file cannot be removed; SR_E_INTERNAL in a forked child.
 */
QV_SR_EXPORT int32_t sr_delete_table_1(sr_opaque_handle_t tree_handle, const char *p_registry_path);

/* ---- Listing tables ------------------------------------------------------ */

/*
 * Lists the tables whose registry paths begin with `p_registry_path`, a
 * plain prefix of the path's text ("/a" lists "/a", "/a/b" and "/ab"):
 *  - Below a mount point, the table files of the mount directory, as
 *    registry paths: mount "/m" on a directory holding "a,b" and "/m/a/b"
 *    is listed. The mount point's own path, with or without its trailing
 *    "/", lists every table of the directory. The lock file ",Lock", side
 *    files ending in ".rewrite", names starting with "." and files whose
 *    names do not begin with the rest of the path are never listed.
 *  - Elsewhere, the transient tables of the tree; persistent tables open in
 *    the tree are not listed here (list their mount point instead).
 * Entries come in directory order below a mount point, in byte order of
 * their paths otherwise.
 *
 * On success *p_table_list receives a malloc'ed array of *array_count
 * malloc'ed strings, an array even when no table is listed; release it with
 * sr_free_table_list_1 (or free() each entry, then the array). On failure
 * nothing is handed out and the two outputs are not changed.
 *
 * The call changes nothing: it works in a forked child too. Returns 0;
 * SR_E_INVALID_HANDLE; SR_E_INVALID_PATH (a null path too);
 * SR_E_NULL_POINTER when an output pointer is null; SR_E_NO_MEMORY;
 * SR_E_ACCESS when the mount directory may not be read; SR_E_SYSTEM_CALL
 * when it cannot be opened ("opendir") or read ("readdir").
 */
QV_SR_EXPORT int32_t sr_list_tables_1(sr_opaque_handle_t tree_handle, const char *p_registry_path,
                                      char ***p_table_list, uint32_t *array_count);

/* Frees a list of sr_list_tables_1: each of the `array_count` entries that
 * is not null, then the array. Returns 0, or SR_E_NULL_POINTER for a null
 * array. */
QV_SR_EXPORT int32_t sr_free_table_list_1(char **p_table_list, uint32_t array_count);

/* ---- Older directory calls -------------------------------------------------
 *
 * Kept for programs written against them. Registry paths have no
 * directories of their own: the directory "/a/b" exists while a table, a
 * mount point or a directory made by sr_i_create_directory_compat has a path
 * below it ("/a/b/t", "/a/b/c/t"). A directory's path may be given with or
 * without a trailing "/"; "/" is the root.
 *
 * Below a mount point every table is one flat file whose name holds its
 * whole path ("/m/a/b/t" is the file "a,b,t"), so nothing on disk stands
 * for a directory: making one there succeeds and reserves nothing, and the
 * directory is listed once a table lies below it. Outside every mount point
 * the tree remembers the directories made, so that they are listed while
 * still empty, until they are deleted or the tree is closed.
 *
 * The records of a listing: `name` is the entry's full registry path, as
 * sr_open_table_1 or another listing takes it; `type` is SR_TABLE or
 * SR_DIRECTORY (a mount point is a directory); `storage` is SR_PERSISTENT
 * below a mount point (a directory: when it is a mount point or lies below
 * one), SR_TRANSIENT otherwise; `p_table_list` is always null.
 */

/*
 * Lists the entries directly below the directory `p_registry_path`: the
 * tables there, and each directory that a deeper path passes through, once.
 * A name may appear twice, once as a table and once as a directory ("/a/b"
 * and "/a/b/c" are both tables). Records are in byte order of their names,
 * a table before a directory of the same name.
 * Below a mount point the tables come from the mount directory's table
 * files, as sr_list_tables_1 finds them; elsewhere from the tree's
 * transient tables.
 *
 * On success *p_p_entries receives a malloc'ed array of *p_total_entries
 * records whose names are malloc'ed, an array even when the directory is
 * empty or does not exist; release it with sr_i_free_directory_list_compat.
 * On failure nothing is handed out.
 *
 * Works in a forked child. Returns 0; SR_E_INVALID_HANDLE;
 * SR_E_NULL_POINTER when an output pointer is null; SR_E_INVALID_PATH;
 * SR_E_NO_MEMORY; SR_E_ACCESS or SR_E_SYSTEM_CALL when the mount directory
 * cannot be read.
 */
QV_SR_EXPORT int32_t sr_i_get_directory_list_compat(sr_opaque_handle_t tree_handle,
                                                    const char *p_registry_path,
                                                    sr_entry_metadata_t **p_p_entries,
                                                    uint32_t *p_total_entries);

/* Frees a list of sr_i_get_directory_list_compat: the names of the
 * `total_entries` records, then the array. Returns 0, or SR_E_NULL_POINTER
 * for a null array. */
QV_SR_EXPORT int32_t sr_i_free_directory_list_compat(sr_entry_metadata_t *p_entries,
                                                     uint32_t total_entries);

/*
 * Makes the directory `p_registry_path`; the directories above it exist by
 * implication. Making one that exists, or the root, succeeds and changes
 * nothing; below a mount point it succeeds and reserves nothing (see
 * above). Returns 0; SR_E_INVALID_HANDLE; SR_E_INVALID_PATH;
 * SR_E_NO_MEMORY; SR_E_INTERNAL in a forked child.
 */
QV_SR_EXPORT int32_t sr_i_create_directory_compat(sr_opaque_handle_t tree_handle,
                                                  const char *p_registry_path);

/*
 * Deletes the directory `p_registry_path` together with the empty
 * directories made below it. It is refused while a table lies below it
 * (below a mount point: a table file whose path does, whether or not the
 * table is open), with SR_E_TABLE_EXISTS, and while a mount point is at or
 * below it, with SR_E_MOUNT_POINT_EXISTS (unmount it first). Deleting a
 * directory that does not exist succeeds, as there is nothing left of it.
 * Returns 0; SR_E_INVALID_HANDLE; SR_E_INVALID_PATH; SR_E_TABLE_EXISTS;
 * SR_E_MOUNT_POINT_EXISTS; SR_E_NO_MEMORY; SR_E_ACCESS or SR_E_SYSTEM_CALL
 * when the mount directory cannot be read; SR_E_INTERNAL in a forked child.
 */
QV_SR_EXPORT int32_t sr_i_delete_directory_compat(sr_opaque_handle_t tree_handle,
                                                  const char *p_registry_path);

/* ---- Packed tables --------------------------------------------------------
 *
 * Several open tables travel to another process, or another machine, in one
 * packed buffer: sr_pack_tables_1 makes it; the receiver converts it to its
 * own byte order once (sr_convert_packed_table_buffer_1), may look at its
 * tables (sr_get_total_packed_tables_1, sr_get_packed_table_name_1) and
 * unpacks each into a read-only table of a tree (sr_unpack_table_1). The
 * bytes are described in docs/packed-buffer-format.md.
 *
 * Ownership. The buffer is one malloc'ed block that belongs to the caller
 * from sr_pack_tables_1 on; release it with free(). Nothing the library
 * keeps points into it: a table name read from it points into it, and an
 * unpacked table has a copy of its rows, so the buffer may be freed as soon
 * as the tables wanted are unpacked.
 *
 * Validation. A buffer comes from outside the process and is not trusted.
 * Its first 4 bytes state its length, and the caller must hand over at
 * least that many readable (and, to convert, writable) bytes; everything
 * else is checked against that length before it is followed: the header,
 * the table count and every length, count, offset and anchor that a call
 * uses. A buffer that does not hold together is refused with
 * SR_E_TABLE_UNREADABLE (14, "2605-014 The table is unreadable."), never
 * read or written outside its stated length. The calls other than the
 * conversion also refuse a buffer that is not in this machine's byte order
 * with that code.
 */

/*
 * Packs `total_tables` open tables into a new buffer, stored in *p_p_buffer
 * (the caller frees it). For table i: p_table_handles[i] is its handle;
 * p_uncommitted_updates_visible[i] not 0 packs its applied view (so does the
 * table's own setting), else its committed view; p_total_row_fixed_indices[i]
 * of 0 packs every row of that view in packed-index order, and a count n
 * packs exactly the rows at the next n fixed indexes of p_row_fixed_indices,
 * which holds the chosen indexes of all tables one after another (it may be
 * null when every count is 0). Each table carries its name (a persistent
 * table its registry path; an unnamed table ""), its row and column counts,
 * change counter, column definitions with qualifiers, properties,
 * structured-data definitions and defaults, and its rows as stored.
 * The read locks of all the tables are taken in array order (a table given
 * twice once) and released in the same order; threads that pack
 * overlapping sets must give them in one order. Zero tables give a buffer
 * of 40 bytes. Returns 0; SR_E_NULL_POINTER; SR_E_INVALID_HANDLE for a null
 * handle; SR_E_NO_ROW_FOR_INDEX for a chosen fixed index outside a table;
 * SR_E_ROW_DELETED for a chosen row the view does not show;
 * SR_E_LIBRARY_CALL; SR_E_NO_MEMORY (also for more than 4 GiB). No buffer
 * on failure. It may be called in a forked child.
 */
QV_SR_EXPORT int32_t sr_pack_tables_1(uint32_t total_tables,
                                      const sr_opaque_handle_t *p_table_handles,
                                      const uint32_t *p_uncommitted_updates_visible,
                                      const uint32_t *p_total_row_fixed_indices,
                                      const uint32_t *p_row_fixed_indices, void **p_p_buffer);

/*
 * Stores the number of tables of a buffer in this machine's byte order.
 * Returns 0; SR_E_NULL_POINTER; SR_E_TABLE_UNREADABLE.
 */
QV_SR_EXPORT int32_t sr_get_total_packed_tables_1(const void *p_buffer,
                                                  uint32_t *p_total_packed_tables);

/*
 * Stores in *p_table_name the name table `table_index` (from 0) was packed
 * under: a NUL-terminated string inside the buffer (no copy; valid while
 * the buffer is). The buffer must be in this machine's byte order.
 * Returns 0; SR_E_NULL_POINTER; SR_E_NO_ROW_FOR_INDEX when the index is not
 * below the table count; SR_E_TABLE_UNREADABLE.
 */
QV_SR_EXPORT int32_t sr_get_packed_table_name_1(const void *p_buffer, uint32_t table_index,
                                                const char **p_table_name);

/*
 * Converts a buffer written on a machine of the other byte order to this
 * machine's, in place. With `header_already_converted` 0 the header tells
 * whether anything needs converting, and is marked converted, so a second
 * call (and a call on a buffer packed here) does nothing and returns 0.
 * Otherwise the caller has taken the header over itself and
 * `do_conversion` not 0 asks for the rest to be converted. Returns 0;
 * SR_E_NULL_POINTER; SR_E_TABLE_UNREADABLE when the buffer does not hold
 * together (it may then be partly converted: discard it);
 * SR_E_LIBRARY_CALL. It takes no lock.
 */
QV_SR_EXPORT int32_t sr_convert_packed_table_buffer_1(void *p_buffer,
                                                      uint32_t header_already_converted,
                                                      int32_t do_conversion);

/*
 * Makes table `table_index` of a buffer in this machine's byte order a
 * transient table of the tree and stores its handle in *p_table. It is
 * named as it was packed (a name "" makes an unnamed table, which
 * sr_close_table_1 frees) and holds the packed rows and columns, every row
 * committed, with the packed change counter. It is read only for good:
 * every change, and opening it for writing, returns SR_E_ACCESS. It keeps
 * its own copy of the rows, in one block that goes when the table is freed
 * (like any named transient table it stays in the tree after its last
 * handle is closed, until the tree is closed); it can be packed again.
 * Key hashing: with a non-null `hash_function` the table gets a key hash
 * table of `total_hash_buckets` buckets hashed by it and compared by
 * `compare_function` (both must be given: SR_E_NULL_POINTER); with a null
 * one a resource-handle key gets the built-in hash and any other key none.
 * Returns 0; SR_E_INVALID_HANDLE; SR_E_NULL_POINTER; SR_E_NO_ROW_FOR_INDEX
 * when the index is not below the table count; SR_E_TABLE_UNREADABLE;
 * SR_E_INVALID_PATH when the name is not a path or lies below a mount point
 * of the tree (an unpacked table has no file); SR_E_TABLE_EXISTS;
 * SR_E_DUPLICATE_KEY when two rows hold one key under SR_PRIMARY_KEY; the
 * codes of sr_create_table_1 for column definitions it would refuse;
 * SR_E_LIBRARY_CALL; SR_E_NO_MEMORY; SR_E_INTERNAL in a forked child.
 */
QV_SR_EXPORT int32_t sr_unpack_table_1(const void *p_buffer, uint32_t total_hash_buckets,
                                       sr_hash_function_t hash_function,
                                       sr_hash_keys_compare_function_t compare_function,
                                       sr_opaque_handle_t tree_handle, uint32_t table_index,
                                       sr_opaque_handle_t *p_table);

/* ---- Diagnostic dumps ------------------------------------------------------ */

/*
 * Print a readable picture of internals to standard output, for people
 * debugging a program or the library; the form is for reading and may
 * change between versions. sr_i_dump_table shows a table: name, mode,
 * counters and transaction state, column definitions, every used position
 * of the row index with the row's state in the two views (committed,
 * added, updated, deleted), its records, file offsets and hash bucket, the
 * free index entries, the pending change lists, the record pool's blocks
 * and free records, the key hash table's occupancy, and for a persistent
 * table its file bookkeeping. It takes the table's read lock.
 * sr_i_dump_tree shows a tree's mount points and every table in it, named
 * and unnamed, under the tree's write lock and each table's read lock.
 * Both return 0, or SR_E_INVALID_HANDLE for a null handle.
 */
QV_SR_EXPORT int32_t sr_i_dump_table(sr_opaque_handle_t table_handle);
QV_SR_EXPORT int32_t sr_i_dump_tree(sr_opaque_handle_t tree_handle);

/* ---- Maintenance ---------------------------------------------------------- */

/*
 * Removes the side files ("<table file>.rewrite") that a crash during an
 * apply or a creation may have left beside the persistent tables named by
 * the `total_paths` registry paths; transient paths are skipped and a
 * missing side file is not an error. Table files are never touched, nor
 * a side file whose lock a live writer holds (an apply, creation or copy
 * under way, in this process or another). It also works in a forked
 * child. Returns 0 (also for a count of 0, whatever the array);
 * SR_E_INVALID_HANDLE; SR_E_NULL_POINTER for a null array; SR_E_INVALID_PATH
 * for a path that cannot be resolved (the paths before it were handled).
 */
QV_SR_EXPORT int32_t sr_repair_tables_1(sr_opaque_handle_t tree_handle,
                                        const char *const *p_registry_paths, uint32_t total_paths);

/*
 * Opens a table exactly as sr_open_table_1 does, for programs written
 * against the older table-file layout (whose column descriptors have the
 * same 28 bytes). `p_rows_hash_table`, when not null, is a key hash table
 * made by the library's internal interface: a table loaded from its file
 * by this call takes it over; otherwise it stays the caller's.
 */
QV_SR_EXPORT int32_t sr_i_open_table_vorel_format(sr_opaque_handle_t tree_handle,
                                                  const char *p_registry_path, int32_t mode,
                                                  struct sr_hash_table_struct_t *p_rows_hash_table,
                                                  sr_opaque_handle_t *p_result_table_handle);

#ifdef __cplusplus
}
#endif

#endif /* QV_SR_H */
