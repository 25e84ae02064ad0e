// compare_main.cpp - the comparison program: runs every registered workload
// of every system (Google Benchmark prints each run as it ends), then prints
// one table that sets each system beside ours, with the ratio of their costs.
//
// The ratio is the other system's time per item divided by ours, so a ratio
// above 1 means ours is faster by that factor; for memory it is the other
// system's bytes per row divided by ours, so above 1 means ours is smaller.

#include <fcntl.h>
#include <lmdb.h>
#include <malloc.h>
#include <sqlite3.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <map>
#include <string>
#include <system_error>
#include <thread>
#include <tuple>
#include <vector>

#include "compare_workloads.h"

namespace compare {

scratch_directory::scratch_directory(const char *p_label) {
  const char *p_base = std::getenv("QV_BENCH_DIR");
  std::string pattern =
      std::string(p_base != nullptr ? p_base : "/var/tmp") + "/qv-bench-" + p_label + "-XXXXXX";
  // A benchmark without its directory would write wherever the empty path
  // leads; stop the run instead.
  if (mkdtemp(pattern.data()) == nullptr) {
    std::perror(pattern.c_str());
    std::exit(1);
  }
  path_ = pattern;
}

scratch_directory::~scratch_directory() {
  if (!path_.empty()) {
    std::error_code ignored;
    std::filesystem::remove_all(path_, ignored);
  }
}

uint64_t file_size(const std::string &path) {
  struct stat status {};
  return stat(path.c_str(), &status) == 0 ? static_cast<uint64_t>(status.st_size) : 0;
}

uint64_t heap_bytes_in_use() {
  const struct mallinfo2 info = mallinfo2();
  return info.uordblks + info.hblkhd;
}

benchmark::internal::Benchmark *add(const std::string &workload, const std::string &system,
                                    void (*function)(benchmark::State &),
                                    const std::vector<int64_t> &rows) {
  benchmark::internal::Benchmark *p_benchmark =
      benchmark::RegisterBenchmark((workload + "/" + system).c_str(), function);
  for (const int64_t count : rows) {
    p_benchmark->Arg(count);
  }
  // Rates count the time a caller waits, flushes to disk included.
  return p_benchmark->UseRealTime();
}

benchmark::internal::Benchmark *add_concurrent_reads(const std::string &system,
                                                     void (*function)(benchmark::State &),
                                                     void (*setup)(const benchmark::State &)) {
  benchmark::internal::Benchmark *p_benchmark =
      add(W11_Concurrent_Reads, system, function, Concurrent_Read_Row_Counts)->Setup(setup);
  for (int threads = 1; threads <= most_concurrent_readers(); threads *= 2) {
    p_benchmark->Threads(threads);
  }
  return p_benchmark;
}

int most_concurrent_readers() {
  return std::thread::hardware_concurrency() >= 4 ? 4 : 2;
}

bool check(benchmark::State &state, bool ok, const char *what) {
  if (!ok) {
    state.SkipWithError(what);
  }
  return ok;
}

namespace {

// One figure of one system: the time per item in nanoseconds, or the bytes
// per row for the memory workload.
struct figure {
  double value;
  bool is_memory;
};

// Collects every run's figure while the console reporter prints the runs.
class comparison_reporter : public benchmark::ConsoleReporter {
 public:
  void ReportRuns(const std::vector<Run> &runs) override {
    ConsoleReporter::ReportRuns(runs);
    for (const Run &run : runs) {
      if (run.error_occurred || run.run_type != Run::RT_Iteration) {
        continue;
      }
      collect(run);
    }
  }

  // The table: per workload and row count, ours first, then each other
  // system with its ratio.
  void print_table() const {
    std::printf("\n%-26s %8s  %-26s %14s  %s\n", "workload", "rows", "system", "figure",
                "ratio (other / ours)");
    for (const auto &[group, systems] : groups_) {
      const auto &[workload, rows] = group;
      const auto ours = systems.find("ours");
      for (const auto &[system, result] : systems) {
        std::string ratio = "-";
        if (system != "ours" && ours != systems.end() && ours->second.value > 0) {
          ratio = format_ratio(result.value / ours->second.value);
        }
        std::printf("%-26s %8s  %-26s %14s  %s\n", workload.c_str(), rows.c_str(), system.c_str(),
                    format_figure(result).c_str(), ratio.c_str());
      }
    }
  }

  // Workload 11 once more, as reads per second of all threads together and
  // their gain over one thread; for ours, also its share of the floor's rate.
  void print_concurrent_reads() const {
    if (concurrent_reads_.empty()) {
      return;
    }
    std::printf("\n%s: reads per second, all threads together\n", W11_Concurrent_Reads);
    std::printf("%8s  %-22s %7s %14s %14s %14s\n", "rows", "system", "threads", "reads/s",
                "over 1 thread", "of the floor");
    for (const auto &[key, rates] : concurrent_reads_) {
      const auto &[rows, system] = key;
      const auto one_thread = rates.find(1);
      const auto floor = concurrent_reads_.find({rows, W11_Floor});
      for (const auto &[threads, rate] : rates) {
        std::string scaling = "-";
        if (one_thread != rates.end()) {
          scaling = format_ratio(rate / one_thread->second);
        }
        std::string of_floor = "-";
        if (system == "ours" && floor != concurrent_reads_.end() &&
            floor->second.contains(threads)) {
          of_floor = format_ratio(rate / floor->second.at(threads));
        }
        std::printf("%8lld  %-22s %7lld %13.2fM %14s %14s\n", static_cast<long long>(rows),
                    system.c_str(), static_cast<long long>(threads), rate / 1e6, scaling.c_str(),
                    of_floor.c_str());
      }
    }
  }

 private:
  void collect(const Run &run) {
    // "<workload>/<system>/<rows>", possibly followed by settings such as
    // "/iterations:1".
    const std::string name = run.benchmark_name();
    const size_t first = name.find('/');
    const size_t second = name.find('/', first + 1);
    if (first == std::string::npos || second == std::string::npos) {
      return;
    }
    const size_t third = name.find('/', second + 1);
    // Runs by several threads are told apart by their thread count.
    std::string workload = name.substr(0, first);
    if (!run.run_name.threads.empty()) {
      workload += "_t" + std::to_string(run.threads);
    }
    const std::string system = name.substr(first + 1, second - first - 1);
    const std::string rows = name.substr(
        second + 1, third == std::string::npos ? std::string::npos : third - second - 1);
    const auto memory = run.counters.find("bytes_per_row");
    const auto rate = run.counters.find("items_per_second");
    if (memory != run.counters.end()) {
      groups_[{workload, rows}][system] = {memory->second.value, true};
    } else if (rate != run.counters.end() && rate->second.value > 0) {
      groups_[{workload, rows}][system] = {1e9 / rate->second.value, false};
      if (workload.starts_with(W11_Concurrent_Reads)) {
        concurrent_reads_[{std::stoll(rows), system}][run.threads] = rate->second.value;
      }
    }
  }

  static std::string format_figure(const figure &result) {
    char text[32];
    if (result.is_memory) {
      std::snprintf(text, sizeof text, "%.0f B/row", result.value);
    } else if (result.value >= 1e6) {
      std::snprintf(text, sizeof text, "%.2f ms/item", result.value / 1e6);
    } else if (result.value >= 1e3) {
      std::snprintf(text, sizeof text, "%.2f us/item", result.value / 1e3);
    } else {
      std::snprintf(text, sizeof text, "%.0f ns/item", result.value);
    }
    return text;
  }

  static std::string format_ratio(double ratio) {
    char text[16];
    std::snprintf(text, sizeof text, "%.2fx", ratio);
    return text;
  }

  // Sorted by workload name (which starts with its number), then by row
  // count as a number.
  struct group_order {
    bool operator()(const std::pair<std::string, std::string> &a,
                    const std::pair<std::string, std::string> &b) const {
      return std::make_tuple(a.first, std::stoll(a.second)) <
             std::make_tuple(b.first, std::stoll(b.second));
    }
  };
  std::map<std::pair<std::string, std::string>, std::map<std::string, figure>, group_order> groups_;
  // Workload 11's rates by rows and system, then by thread count.
  std::map<std::pair<int64_t, std::string>, std::map<int64_t, double>> concurrent_reads_;
};

void print_settings() {
  std::printf(
      "\nSettings: SQLite %s, prepared statements, loads in one transaction; "
      "sqlite-memory is \":memory:\", sqlite-file(<journal_mode>,<synchronous>) a file with "
      "those pragmas. LMDB %d.%d.%d with default durability. protocol-io: append a record "
      "and fdatasync, overwrite 4 bytes and fdatasync (the I/O of one committed change). "
      "read-file: open and one read of a file as large as the rows. unordered_map: "
      "std::unordered_map<std::string, row>. Selections: SQLite steps through a prepared "
      "SELECT rowid with no index on the columns it tests, and copies with CREATE TEMP TABLE "
      "... AS SELECT under temp_store=MEMORY; record-loop reads our row records in a loop "
      "written by hand. Shipping: memcpy+read copies the packed bytes and reads our table "
      "in place; index-build builds the unpacked table's row index and key hash table again "
      "from its records by a loop written by hand.\n",
      sqlite3_libversion(), MDB_VERSION_MAJOR, MDB_VERSION_MINOR, MDB_VERSION_PATCH);
}

}  // namespace
}  // namespace compare

int main(int argc, char **argv) {
  benchmark::Initialize(&argc, argv);
  if (benchmark::ReportUnrecognizedArguments(argc, argv)) {
    return 1;
  }
  compare::register_ours();
  compare::register_sqlite();
  compare::register_lmdb();
  compare::register_floors();
  compare::register_record_floor();
  compare::register_index_floor();
  compare::comparison_reporter reporter;
  benchmark::RunSpecifiedBenchmarks(&reporter);
  reporter.print_table();
  reporter.print_concurrent_reads();
  compare::print_settings();
  benchmark::Shutdown();
  return 0;
}
