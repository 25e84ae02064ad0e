// sr_i_duplicate_table.cpp - the engine of copying and moving tables: a
// source (an open table, or a table file no one has open here) carried to a
// target path in memory or on disk.
//
// A persistent target gets a complete new file, written beside it and
// renamed over it under the target locks, so that its readers find the old
// table or the new one; a target open in this tree is then read again from
// the new file into its own object, so its handles go on with the new
// content. A transient target is a table object entered in the tree: the
// source object itself when it moves (its handles move with it), a copy
// when it is kept, or the source file loaded into memory. The source is
// removed only once the target is complete.

#include <fcntl.h>

#include <cstdlib>
#include <cstring>
#include <memory>
#include <utility>
#include <vector>

#include "frame/sr_i_errors.h"
#include "frame/sr_i_paths.h"
#include "namespace/sr_i_namespace.h"
#include "queries/sr_i_select.h"
#include "schema/sr_i_application_metadata.h"
#include "schema/sr_i_schema_changes.h"
#include "storage/sr_i_files.h"
#include "storage/sr_i_storage.h"
#include "storage/sr_i_table_file.h"
#include "tables/sr_i_hash_table.h"

namespace {

// A file copy moves this much per read and write.
constexpr uint32_t Copy_Block_Bytes = 1u << 20;

// A registry path resolved in the tree: its key, and the block size of its
// mount point (0 for a transient path).
struct resolved_path {
  std::string key;
  uint32_t block_size = 0;
  bool persistent() const { return block_size != 0; }
};

int32_t resolve(const sr_i_tree_t *p_tree, const char *p_registry_path, resolved_path &path) {
  return sr_i_resolve_path(p_tree, p_registry_path, path.key, path.block_size);
}

sr_i_table_t *open_table_at(const sr_i_tree_t *p_tree, const std::string &key) {
  const auto found = p_tree->tables.find(key);
  return found != p_tree->tables.end() ? found->second : nullptr;
}

struct table_closer {
  sr_i_table_t *p_table;
  ~table_closer() { sr_i_close_table(p_table); }
  sr_i_table_t *release() { return std::exchange(p_table, nullptr); }
};

std::string directory_of(const std::string &file) {
  return file.substr(0, file.rfind('/') + 1);
}

bool has_changes_on_the_way(const sr_i_table_t *p_table) {
  return p_table->ready_for_commit != Sr_Nothing_Applied ||
         p_table->p_rows_change_list != nullptr || p_table->p_delete_rows_change_list != nullptr;
}

// Copies the file `source_file` into `fd` a block at a time.
int32_t copy_file_contents(const std::string &source_file, int fd, const std::string &path) {
  int source_fd = -1;
  if (const int32_t rc = sr_i_open_file(source_file.c_str(), O_RDONLY, &source_fd); rc != 0) {
    return rc;
  }
  std::unique_ptr<unsigned char[]> block(new (std::nothrow) unsigned char[Copy_Block_Bytes]);
  int32_t rc = block == nullptr ? sr_i_raise_no_memory() : 0;
  for (uint32_t got = Copy_Block_Bytes; rc == 0 && got == Copy_Block_Bytes;) {
    rc = sr_i_read(source_fd, block.get(), Copy_Block_Bytes, &got);
    if (rc == 0 && got > 0) {
      rc = sr_i_write(fd, path.c_str(), block.get(), got);
    }
  }
  sr_i_close_file(source_fd);
  return rc;
}

// The rewrite file a copy writes its target into, locked from before its
// first byte until it has the target's name, as a writer's rewrite file is.
// Another process creating the target at this moment holds that lock while
// it writes the table's first file: the copy finds the lock taken, or the
// file gone to the target's name before it got the lock, and fails with
// 201, the target being made. A file a crash left behind is taken over and
// emptied. A file that is this copy's and was not renamed is removed.
class side_file {
 public:
  explicit side_file(const std::string &target_file) : path_(target_file + ".rewrite") {}
  side_file(const side_file &) = delete;
  side_file &operator=(const side_file &) = delete;
  ~side_file() {
    if (owned_ && !renamed_) {
      sr_i_discard_file(path_.c_str());
    }
  }

  // Opens, locks and empties the file, unless that is done already.
  // Returns 0, 201 or a failure of the calls, raised.
  int32_t open() {
    if (owned_) {
      return 0;
    }
    if (const int32_t rc = sr_i_open_file(path_.c_str(), O_RDWR | O_CREAT, &locked_.fd); rc != 0) {
      return rc;
    }
    bool locked = false;
    if (const int32_t rc = sr_i_try_lock_file(locked_.fd, &locked); rc != 0) {
      return rc;
    }
    bool same = false;
    if (locked) {
      if (const int32_t rc = sr_i_is_same_file(locked_.fd, path_.c_str(), &same); rc != 0) {
        return rc;
      }
    }
    if (!same) {
      return sr_i_raise(SR_E_TABLE_EXISTS);
    }
    owned_ = true;
    return sr_i_truncate(locked_.fd, path_.c_str(), 0);
  }

  // Writes the file through `write(fd, path)` and flushes it.
  template <typename Write>
  int32_t write(Write &&write) {
    if (const int32_t rc = write(locked_.fd, path_); rc != 0) {
      return rc;
    }
    return sr_i_flush_file(locked_.fd, path_.c_str());
  }

  const std::string &path() const { return path_; }
  // The descriptor that holds the lock, for whoever takes it over.
  sr_i_descriptor &locked() { return locked_; }
  // The file has the target's name now: it is no longer removed.
  void renamed() { renamed_ = true; }

 private:
  std::string path_;
  sr_i_descriptor locked_;
  bool owned_ = false;
  bool renamed_ = false;
};

// The open mode that loads a table again as it is open now.
int32_t open_mode_of(const sr_i_table_t *p_table) {
  if ((p_table->mode & Sr_Mode_Writable) == 0) {
    return SR_MODE_READ;
  }
  return p_table->implicitly_controlled != 0 ? SR_MODE_WRITE : SR_MODE_WRITE_EXPLICIT;
}

// The table file `file` read into a new object opened as `p_like` is, with
// a key hash table like its own, not in the tree. `locked` holds the lock
// of `file`: a writable object takes that descriptor over, since one of its
// own would wait for the lock for ever.
int32_t open_like(sr_i_tree_t *p_tree, const sr_i_table_t *p_like, const std::string &file,
                  sr_i_descriptor &locked, sr_i_table_t **pp_fresh) {
  sr_hash_table_t *p_hash_table = nullptr;
  if (const int32_t rc = sr_i_hash_table_open_like(p_like->p_rows_hash_table, &p_hash_table);
      rc != 0) {
    return rc;
  }
  const int32_t mode = open_mode_of(p_like);
  const int handed_over = (mode & SR_MODE_WRITE) != 0 ? std::exchange(locked.fd, -1) : -1;
  return sr_i_open_persistent_table(p_tree, p_like->p_persistent_table_registry_path, file.c_str(),
                                    mode, p_like->block_size, p_hash_table, pp_fresh, handed_over);
}

// Gives an open persistent target the image of `p_fresh`, read from its new
// file, under the target's write lock: its rows, columns, counters,
// application metadata and file; its handles, name and mode stay. Closes
// `p_fresh`, which takes the old image and descriptor with it.
int32_t take_new_image(sr_i_table_t *p_target, sr_i_table_t *p_fresh) {
  table_closer closer{p_fresh};
  sr_i_write_guard target_lock(&p_target->lock);
  if (target_lock.result() != 0) {
    return target_lock.result();
  }
  sr_i_swap_after_metadata_update(p_target, p_fresh);
  std::swap(p_target->p_application_metadata, p_fresh->p_application_metadata);
  return 0;
}

// A table with nothing left of a file: what a table loaded from a file or
// moved off the disk becomes, so that its later commits stay in memory.
void forget_file(sr_i_table_t *p_table) {
  sr_i_close_table_file(std::exchange(p_table->p_file, nullptr));
  std::free(std::exchange(p_table->p_persistent_table_registry_path, nullptr));
  p_table->block_size = 0;
}

// Gives a table the name `key`: 0 or 12.
int32_t rename_object(sr_i_table_t *p_table, const std::string &key) {
  char *p_name = strdup(key.c_str());
  if (p_name == nullptr) {
    return sr_i_raise_no_memory();
  }
  std::free(std::exchange(p_table->p_name, p_name));
  return 0;
}

// A committed copy of the applied view of an open table, named `key`, with
// the source's application metadata and change counter, not yet in the
// tree and held by no handle.
int32_t copy_in_memory(sr_i_table_t *p_source, const std::string &key, sr_i_table_t **pp_copy) {
  std::vector<uint32_t> columns(p_source->total_columns);
  for (uint32_t column = 0; column < p_source->total_columns; ++column) {
    columns[column] = column;
  }
  sr_i_table_t *p_copy = nullptr;
  if (const int32_t rc = sr_i_select_columns(p_source, columns, nullptr, 1, &p_copy); rc != 0) {
    return rc;
  }
  table_closer closer{p_copy};
  sr_i_application_metadata_t *p_metadata = nullptr;
  if (const int32_t rc =
          sr_i_duplicate_application_metadata_buffer(p_source->p_application_metadata, &p_metadata);
      rc != 0) {
    return rc;
  }
  sr_i_free_application_metadata(std::exchange(p_copy->p_application_metadata, p_metadata));
  if (const int32_t rc = rename_object(p_copy, key); rc != 0) {
    return rc;
  }
  p_copy->change_counter = p_copy->applied_change_counter = p_source->change_counter;
  p_copy->implicitly_controlled = 1;
  p_copy->references = 0;
  *pp_copy = closer.release();
  return 0;
}

// The table file `source_file` loaded into memory as a table named `key`
// that no longer refers to the file, not yet in the tree.
int32_t load_into_memory(sr_i_tree_t *p_tree, const std::string &source_file,
                         const std::string &key, sr_i_table_t **pp_loaded) {
  sr_i_table_t *p_loaded = nullptr;
  if (const int32_t rc =
          sr_i_open_persistent_table(p_tree, nullptr, source_file.c_str(), SR_MODE_READ,
                                     Sr_Mount_Block_Size, nullptr, &p_loaded);
      rc != 0) {
    return rc;
  }
  table_closer closer{p_loaded};
  forget_file(p_loaded);
  if (const int32_t rc = rename_object(p_loaded, key); rc != 0) {
    return rc;
  }
  p_loaded->mode = Sr_Mode_Writable;
  p_loaded->references = 0;
  *pp_loaded = closer.release();
  return 0;
}

// One copy or move, with the tree's write lock held.
class duplication {
 public:
  duplication(sr_i_tree_t *p_tree, bool remove_source, bool overwrite)
      : p_tree_(p_tree), remove_source_(remove_source), overwrite_(overwrite) {}

  int32_t run(sr_i_table_t *p_source, const char *p_source_path, const char *p_target_path) {
    if (const int32_t rc = find_source(p_source, p_source_path); rc != 0) {
      return rc;
    }
    if (const int32_t rc = resolve(p_tree_, p_target_path, target_); rc != 0) {
      return rc;
    }
    p_target_path_ = p_target_path;
    p_open_target_ = open_table_at(p_tree_, target_.key);
    if (p_source_ != nullptr ? p_open_target_ == p_source_ : source_file_ == target_.key) {
      // A table onto its own path: there is nothing to carry.
      return overwrite_ ? 0 : sr_i_raise(SR_E_TABLE_EXISTS);
    }
    int32_t rc = 0;
    bool source_done = false;  // the source was moved along with the target
    {
      // A source that moves is renamed or taken apart: no reader of it may
      // be inside meanwhile.
      std::unique_ptr<sr_i_write_guard> write_lock;
      std::unique_ptr<sr_i_read_guard> read_lock;
      if (p_source_ != nullptr && remove_source_) {
        write_lock = std::make_unique<sr_i_write_guard>(&p_source_->lock);
        rc = write_lock->result();
      } else if (p_source_ != nullptr) {
        read_lock = std::make_unique<sr_i_read_guard>(&p_source_->lock);
        rc = read_lock->result();
      }
      if (rc == 0) {
        rc = target_.persistent() ? to_disk(source_done) : to_memory(source_done);
      }
    }
    if (rc == 0 && remove_source_ && !source_done && p_source_ != nullptr) {
      // The target is complete: a failure to remove the source leaves both
      // (only a want of memory is reported: the source's file is gone).
      if (p_source_->p_file != nullptr) {
        sr_i_remove_table_files(p_source_->p_file->path);
      }
      rc = sr_i_detach_table(p_tree_, p_source_);
    }
    return rc;
  }

 private:
  int32_t find_source(sr_i_table_t *p_source, const char *p_source_path) {
    if (p_source != nullptr) {
      p_source_ = p_source;
      return 0;
    }
    resolved_path source;
    if (const int32_t rc = resolve(p_tree_, p_source_path, source); rc != 0) {
      return rc;
    }
    p_source_ = open_table_at(p_tree_, source.key);
    if (p_source_ == nullptr && !source.persistent()) {
      return sr_i_raise(SR_E_NO_TABLE);
    }
    if (p_source_ == nullptr) {
      source_file_ = std::move(source.key);
    }
    return 0;
  }

  int32_t to_disk(bool &source_done) {
    if (p_open_target_ != nullptr && has_changes_on_the_way(p_open_target_)) {
      return sr_i_raise(SR_E_UNCOMMITTED);
    }
    sr_i_table_t *p_fresh = nullptr;
    int32_t rc = 0;
    {
      sr_i_target_lock locks;
      if ((rc = locks.lock(target_.key, p_open_target_)) != 0) {
        return rc;
      }
      if (locks.target_length() != 0 && !overwrite_) {
        return sr_i_raise(SR_E_TABLE_EXISTS);
      }
      // A missing target has no lock of its own, but its side file does: a
      // process creating the target holds it while it writes. So the side
      // file is locked first, whichever way the table goes, and once it is
      // had the target is either still missing, and no creator can finish
      // meanwhile, or made by that creator, and left to it.
      side_file side(target_.key);
      if (!locks.holds_target()) {
        if ((rc = side.open()) != 0) {
          return rc;
        }
        bool exists = false;
        if ((rc = sr_i_path_exists(target_.key.c_str(), &exists)) != 0) {
          return rc;
        }
        if (exists) {
          return sr_i_raise(SR_E_TABLE_EXISTS);
        }
      }
      rc = moves_its_own_file() ? move_open_file(source_done) : write_target_file(side, &p_fresh);
    }
    // The file locks are given up first: the fresh image holds the writer's
    // lock of the new file on its own descriptor. Once renamed, the new file
    // is the target's even if the flush of its directory failed: the open
    // table follows it, and the failure is returned.
    if (p_fresh != nullptr) {
      const int32_t swapped = take_new_image(p_open_target_, p_fresh);
      rc = rc != 0 ? rc : swapped;
    }
    return rc;
  }

  // Whether the source is a table file open here that moves within its
  // directory, where one rename carries it: a crash then leaves it at its
  // source or its target, never at both. A rewrite waiting for commit, or a
  // target open here, takes the way of a copy.
  bool moves_its_own_file() const {
    return p_source_ != nullptr && remove_source_ && p_source_->p_file != nullptr &&
           p_open_target_ == nullptr && p_source_->ready_for_commit != Sr_Applied_By_Rewrite &&
           directory_of(p_source_->p_file->path) == directory_of(target_.key);
  }

  // Renames the open source's file over the target and moves the table
  // object to the target's path, handles, pending changes and file lock
  // with it. Once renamed (`source_done`), a failure is only the flush of
  // the directory.
  int32_t move_open_file(bool &source_done) {
    // Everything the object will need is made first, so that nothing can
    // fail once the file has its new name.
    std::string path = target_.key;
    std::string rewrite_path = target_.key + ".rewrite";
    std::unique_ptr<char, decltype(&std::free)> name(strdup(target_.key.c_str()), &std::free);
    std::unique_ptr<char, decltype(&std::free)> registry_path(strdup(p_target_path_), &std::free);
    if (name == nullptr || registry_path == nullptr) {
      return sr_i_raise_no_memory();
    }
    sr_i_named_table_place place;
    if (const int32_t rc = sr_i_make_named_table_place(target_.key, place); rc != 0) {
      return rc;
    }
    sr_i_table_file_t &file = *p_source_->p_file;
    bool renamed = false;
    const int32_t rc = sr_i_rename_durably(file.path.c_str(), target_.key.c_str(), &renamed);
    if (!renamed) {
      return rc;
    }
    sr_i_take_out_of_tree(p_tree_, p_source_);
    std::swap(file.path, path);
    std::swap(file.rewrite_path, rewrite_path);
    std::free(std::exchange(p_source_->p_name, name.release()));
    std::free(std::exchange(p_source_->p_persistent_table_registry_path, registry_path.release()));
    source_done = true;
    sr_i_enter_table_at(p_tree_, std::move(place), p_source_);
    return rc;
  }

  // Opens and locks the source file. A writer that committed by renaming a
  // new file over it meanwhile gave up the lock of the old one: the lock
  // is taken again on the file the name holds now.
  int32_t lock_source_file(sr_i_descriptor &source) const {
    for (;;) {
      if (const int32_t rc = sr_i_open_file(source_file_.c_str(), O_RDWR, &source.fd); rc != 0) {
        return rc;
      }
      bool same = false;
      if (const int32_t rc = sr_i_lock_file(source.fd); rc != 0) {
        return rc;
      }
      if (const int32_t rc = sr_i_is_same_file(source.fd, source_file_.c_str(), &same);
          rc != 0 || same) {
        return rc;
      }
      sr_i_close_file(std::exchange(source.fd, -1));
    }
  }

  // The new target file, from the source object, by renaming the source
  // file, or as a copy of it through the locked `side` file. A target open
  // here gets `*pp_fresh`, its new image, once the new file is in place.
  int32_t write_target_file(side_file &side, sr_i_table_t **pp_fresh) {
    if (p_source_ != nullptr || !remove_source_) {
      return copy_into_place(side, pp_fresh);
    }
    // Between table files a move is one rename. A writer of the source in
    // another process holds its file's lock while it has the table open:
    // the move waits for it, so that no commit of that writer renames a
    // new file onto the old name after the table has left it.
    sr_i_descriptor source;
    if (const int32_t rc = lock_source_file(source); rc != 0) {
      return rc;
    }
    bool same_file_system = false;
    if (const int32_t rc = sr_i_is_on_file_system_of(source.fd, directory_of(target_.key).c_str(),
                                                     &same_file_system);
        rc != 0) {
      return rc;
    }
    if (!same_file_system) {
      // No rename crosses file systems: the file is copied, and removed
      // once the copy has the target's name, its lock held all the while.
      // A failure to remove it leaves the table at both paths, and says so.
      if (const int32_t rc = copy_into_place(side, pp_fresh); rc != 0) {
        return rc;
      }
      return sr_i_remove_table_files(source_file_);
    }
    // Everything named before the rename, which nothing may follow that
    // could fail for want of memory.
    const std::string source_side_file = source_file_ + ".rewrite";
    const std::string source_directory = directory_of(source_file_);
    const bool other_directory = source_directory != directory_of(target_.key);
    bool renamed = false;
    const int32_t rc = rename_into_place(source_file_, source, pp_fresh, &renamed);
    if (!renamed) {
      return rc;
    }
    sr_i_discard_file(source_side_file.c_str());
    // The source's name is gone from its directory too, if that is
    // another one.
    return rc != 0 || !other_directory ? rc : sr_i_flush_directory(source_directory.c_str());
  }

  // Writes the new target file into the side file, locked, from the source
  // object or as a copy of the source file, and renames it into place.
  int32_t copy_into_place(side_file &side, sr_i_table_t **pp_fresh) {
    if (const int32_t rc = side.open(); rc != 0) {
      return rc;
    }
    if (const int32_t rc = side.write([&](int fd, const std::string &path) {
          return p_source_ != nullptr ? sr_i_write_table_file(p_source_, fd, path)
                                      : copy_file_contents(source_file_, fd, path);
        });
        rc != 0) {
      return rc;
    }
    bool renamed = false;
    const int32_t rc = rename_into_place(side.path(), side.locked(), pp_fresh, &renamed);
    if (renamed) {
      side.renamed();
    }
    return rc;
  }

  // Renames the complete file `from`, whose lock `locked` holds, over the
  // target and flushes the directory. A target open here first reads `from`
  // into a fresh image, so that nothing is left to fail between the rename
  // and the exchange of images; the image goes to `*pp_fresh` once the file
  // has the target's name (`*p_renamed`), even if the flush of the
  // directory failed.
  int32_t rename_into_place(const std::string &from, sr_i_descriptor &locked,
                            sr_i_table_t **pp_fresh, bool *p_renamed) {
    sr_i_table_t *p_fresh = nullptr;
    if (p_open_target_ != nullptr) {
      if (const int32_t rc = open_like(p_tree_, p_open_target_, from, locked, &p_fresh); rc != 0) {
        return rc;
      }
    }
    table_closer closer{p_fresh};
    std::string path = target_.key;
    std::string rewrite_path = target_.key + ".rewrite";
    const int32_t rc = sr_i_rename_durably(from.c_str(), target_.key.c_str(), p_renamed);
    if (*p_renamed && p_fresh != nullptr) {
      p_fresh->p_file->path = std::move(path);
      p_fresh->p_file->rewrite_path = std::move(rewrite_path);
      *pp_fresh = closer.release();
    }
    return rc;
  }

  int32_t to_memory(bool &source_done) {
    if (p_open_target_ != nullptr && !overwrite_) {
      return sr_i_raise(SR_E_TABLE_EXISTS);
    }
    // Everything that takes memory is made first: the places of the target
    // and of an open target it replaces, and the moved object's new name.
    // Once a source file is gone or an object has left its old name, there
    // is no way back, and an object could not be freed under its handles.
    sr_i_named_table_place place;
    if (const int32_t rc = sr_i_make_named_table_place(target_.key, place); rc != 0) {
      return rc;
    }
    sr_i_detached_place replaced_place;
    if (p_open_target_ != nullptr) {
      if (const int32_t rc = sr_i_make_detached_place(p_open_target_, replaced_place); rc != 0) {
        return rc;
      }
    }
    sr_i_table_t *p_new = nullptr;
    // A source file that is gone although the flush of its directory
    // failed leaves the table in memory alone: it is entered under the
    // target all the same, and the failure returned.
    int32_t removal = 0;
    bool removed = false;
    if (p_source_ != nullptr && remove_source_) {
      std::unique_ptr<char, decltype(&std::free)> name(strdup(target_.key.c_str()), &std::free);
      if (name == nullptr) {
        return sr_i_raise_no_memory();
      }
      if (p_source_->p_file != nullptr &&
          (removal = sr_i_remove_table_files(p_source_->p_file->path, &removed)) != 0 && !removed) {
        return removal;
      }
      std::free(std::exchange(p_source_->p_name, name.release()));
      // Out of the tree under its old name, in again under the new one.
      sr_i_take_out_of_tree(p_tree_, p_source_);
      forget_file(p_source_);
      p_new = p_source_;
      source_done = true;
    } else if (p_source_ != nullptr) {
      if (const int32_t rc = copy_in_memory(p_source_, target_.key, &p_new); rc != 0) {
        return rc;
      }
    } else {
      if (const int32_t rc = load_into_memory(p_tree_, source_file_, target_.key, &p_new);
          rc != 0) {
        return rc;
      }
      table_closer loaded{p_new};
      if (remove_source_ && (removal = sr_i_remove_table_files(source_file_, &removed)) != 0 &&
          !removed) {
        return removal;
      }
      loaded.release();
    }
    if (p_open_target_ != nullptr) {
      sr_i_detach_table_at(p_tree_, p_open_target_, std::move(replaced_place));
    }
    sr_i_enter_table_at(p_tree_, std::move(place), p_new);
    return removal;
  }

  sr_i_tree_t *p_tree_;
  bool remove_source_;
  bool overwrite_;
  sr_i_table_t *p_source_ = nullptr;
  std::string source_file_; /* a source no one has open here */
  resolved_path target_;
  sr_i_table_t *p_open_target_ = nullptr;
  const char *p_target_path_ = nullptr;
};

}  // namespace

int32_t sr_i_duplicate_table(sr_i_tree_t *p_tree, sr_i_table_t *p_source, const char *p_source_path,
                             const char *p_target_path, bool remove_source, bool overwrite) {
  sr_i_write_guard tree_lock(&p_tree->lock);
  if (tree_lock.result() != 0) {
    return tree_lock.result();
  }
  return duplication(p_tree, remove_source, overwrite).run(p_source, p_source_path, p_target_path);
}
