// compare_floors.cpp - the floors of the comparison: the bare work with no
// database around it. A std::unordered_map for reads by key and for memory
// per row, the I/O of one committed change and nothing else, and one read()
// of a file the size of a table for open and scan, and for shipping a table
// a copy of its packed bytes and our own read of it in place. They show how
// far each library is from what the machine itself costs.

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstdlib>
#include <cstring>
#include <string>
#include <unordered_map>
#include <utility>
#include <vector>

#include "compare_ours.h"
#include "compare_workloads.h"

namespace compare {
namespace {

constexpr const char *Map_System = "unordered_map";
constexpr const char *Protocol_System = "protocol-io";
constexpr const char *Read_File_System = "read-file";
constexpr const char *Copy_And_Read_System = "memcpy+read";

// The size of one change record, and where in it the word that marks it
// committed lies.
constexpr size_t Record_Size = 160;
constexpr off_t Type_Word_Offset = 0;
constexpr uint32_t Pending_Record = 0x50454e44;
constexpr uint32_t Committed_Record = 0x434f4d54;

// Bytes the read-file floor reads per row: about what a row takes in a table
// file.
constexpr size_t File_Bytes_Per_Row = 96;

struct map_row {
  int32_t count;
  int64_t total;
  double ratio;
  std::string note;
};
using row_map = std::unordered_map<std::string, map_row>;

class file_descriptor {
 public:
  explicit file_descriptor(int fd) : fd_(fd) {}
  ~file_descriptor() {
    if (fd_ >= 0) {
      ::close(fd_);
    }
  }
  file_descriptor(const file_descriptor &) = delete;
  file_descriptor &operator=(const file_descriptor &) = delete;

  bool valid() const { return fd_ >= 0; }
  int get() const { return fd_; }
  bool close() { return ::close(std::exchange(fd_, -1)) == 0; }

 private:
  int fd_;
};

// Fills `map` with rows 0 .. rows-1; false unless every row went in.
bool fill(row_map &map, uint32_t rows) {
  map.reserve(rows);
  for (uint32_t i = 0; i < rows; ++i) {
    const config_row row = make_row(i);
    map.emplace(row.key, map_row{row.count, row.total, row.ratio, row.note});
  }
  return map.size() == rows;
}

void map_read_by_key(benchmark::State &state) {
  const auto rows = static_cast<uint32_t>(state.range(0));
  row_map map;
  if (!check(state, fill(map, rows), "fill")) {
    return;
  }
  const std::vector<std::string> keys = lookup_keys(rows);
  size_t next = 0;
  for (auto _ : state) {
    const auto found = map.find(keys[next]);
    if (!check(state, found != map.end(), "find")) {
      return;
    }
    // A copy the caller owns, as a registry read hands over: both strings
    // are longer than the short-string buffer, so each takes an allocation.
    std::string key = found->first;
    map_row row = found->second;
    benchmark::DoNotOptimize(key);
    benchmark::DoNotOptimize(row);
    next = next + 1 == keys.size() ? 0 : next + 1;
  }
  state.SetItemsProcessed(state.iterations());
}

void map_memory(benchmark::State &state) {
  const auto rows = static_cast<uint32_t>(state.range(0));
  for (auto _ : state) {
    const uint64_t before = heap_bytes_in_use();
    row_map map;
    const bool filled = fill(map, rows);
    const uint64_t after = heap_bytes_in_use();
    if (!check(state, filled && after > before, "fill")) {
      return;
    }
    state.counters["bytes_per_row"] = static_cast<double>(after - before) / rows;
  }
}

bool write_word(int fd, uint32_t word, off_t offset) {
  return pwrite(fd, &word, sizeof word, offset) == static_cast<ssize_t>(sizeof word);
}

// The I/O our library does for one committed change, and nothing else: the
// change record is appended and flushed, then its type word is overwritten to
// mark it committed and flushed again. The first flush keeps the mark from
// reaching the disk before the record it marks.
void protocol_io(benchmark::State &state) {
  scratch_directory directory("protocol-io");
  const std::string path = directory.file("table.log");
  file_descriptor file(open(path.c_str(), O_RDWR | O_CREAT | O_TRUNC | O_CLOEXEC, 0644));
  if (!check(state, file.valid(), "open")) {
    return;
  }
  char record[Record_Size];
  std::memset(record, 'c', sizeof record);
  std::memcpy(record + Type_Word_Offset, &Pending_Record, sizeof Pending_Record);
  off_t end = 0;
  for (auto _ : state) {
    const bool committed =
        pwrite(file.get(), record, sizeof record, end) == static_cast<ssize_t>(sizeof record) &&
        fdatasync(file.get()) == 0 &&
        write_word(file.get(), Committed_Record, end + Type_Word_Offset) &&
        fdatasync(file.get()) == 0;
    if (!check(state, committed, "write")) {
      return;
    }
    end += Record_Size;
  }
  state.SetItemsProcessed(state.iterations());
}

bool write_file(const std::string &path, size_t bytes) {
  file_descriptor file(open(path.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0644));
  const std::vector<char> contents(bytes, 'r');
  return file.valid() && write(file.get(), contents.data(), bytes) == static_cast<ssize_t>(bytes) &&
         file.close();
}

// Open, size and read a whole file of the table's size in one call, then
// close it: the least a new reader of a table file can do.
void read_file(benchmark::State &state) {
  const auto rows = static_cast<uint32_t>(state.range(0));
  scratch_directory directory("read-file");
  const std::string path = directory.file("table.dat");
  std::vector<char> buffer(rows * File_Bytes_Per_Row);
  if (!check(state, write_file(path, buffer.size()), "write file")) {
    return;
  }
  for (auto _ : state) {
    file_descriptor file(open(path.c_str(), O_RDONLY | O_CLOEXEC));
    struct stat status;
    const bool read_whole =
        file.valid() && fstat(file.get(), &status) == 0 &&
        static_cast<size_t>(status.st_size) == buffer.size() &&
        read(file.get(), buffer.data(), buffer.size()) == static_cast<ssize_t>(buffer.size()) &&
        file.close();
    if (!check(state, read_whole, "read")) {
      return;
    }
    benchmark::DoNotOptimize(buffer.data());
    benchmark::ClobberMemory();
  }
  state.SetItemsProcessed(state.iterations() * rows);
}

// What shipping a table costs at least: the packed bytes copied once, as a
// transfer would, and our own read of every value of a table already in
// memory, with no packing and no unpacking.
void copy_and_read(benchmark::State &state) {
  const auto rows = static_cast<uint32_t>(state.range(0));
  sr_opaque_handle_t table = loaded_transient_table(rows);
  const uint32_t committed_view = 0, all_rows = 0;
  void *p_buffer = nullptr;
  if (!check(state,
             table != nullptr && sr_pack_tables_1(1, &table, &committed_view, &all_rows, nullptr,
                                                  &p_buffer) == 0,
             "pack the table")) {
    return;
  }
  uint32_t length;
  std::memcpy(&length, p_buffer, sizeof length);
  std::vector<unsigned char> copy(length);
  for (auto _ : state) {
    std::memcpy(copy.data(), p_buffer, length);
    benchmark::ClobberMemory();
    if (!check(state, read_every_value(table, rows), "read every value")) {
      break;
    }
  }
  std::free(p_buffer);
  state.SetItemsProcessed(state.iterations() * rows);
}

}  // namespace

void register_floors() {
  const std::vector<int64_t> durable_rows = {Durable_Table_Rows};
  add(W1_Read_By_Key, Map_System, &map_read_by_key)->UseRealTime();
  add(W4_Durable_Set, Protocol_System, &protocol_io, durable_rows)->UseRealTime();
  add(W4_Durable_Add, Protocol_System, &protocol_io, durable_rows)->UseRealTime();
  add(W6_Open_And_Scan, Read_File_System, &read_file)->UseRealTime();
  add(W7_Memory, Map_System, &map_memory)->Iterations(1)->UseRealTime();
  add(W10_Ship_Table, Copy_And_Read_System, &copy_and_read, Ship_Row_Counts)
      ->Unit(benchmark::kMillisecond);
}

}  // namespace compare
