// listing_bench.cpp - listing a mount directory of 10,000 tables with
// sr_list_tables_1, beside the floor: one readdir walk of the same
// directory, looking at every name. Listing reads names only, never the
// files, so the tables are empty files under table names ("svc,<n>",
// registry paths /disk/svc/<n>), with the ",Lock" file and a few side files
// among them as a mount directory has. Files go to $QV_BENCH_DIR (default
// /var/tmp).

#include <benchmark/benchmark.h>
#include <dirent.h>
#include <fcntl.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <string>
#include <system_error>

#include "qv_sr.h"

namespace {

constexpr int Tables = 10000;

// The mount directory, filled once for every benchmark of the program.
class table_directory {
 public:
  table_directory() {
    const char *p_base = std::getenv("QV_BENCH_DIR");
    std::string pattern =
        std::string(p_base != nullptr ? p_base : "/var/tmp") + "/qv-listing-XXXXXX";
    if (mkdtemp(pattern.data()) == nullptr) {
      std::perror(pattern.c_str());
      std::exit(1);
    }
    path_ = pattern;
    for (int table = 0; table < Tables; ++table) {
      make_file("svc," + std::to_string(table));
    }
    make_file(",Lock");
    for (int table = 0; table < 10; ++table) {
      make_file("svc," + std::to_string(table) + ".rewrite");
    }
  }
  ~table_directory() {
    std::error_code ignored;
    std::filesystem::remove_all(path_, ignored);
  }
  table_directory(const table_directory &) = delete;
  table_directory &operator=(const table_directory &) = delete;
  const std::string &path() const { return path_; }

 private:
  void make_file(const std::string &name) const {
    const int fd = open((path_ + "/" + name).c_str(), O_WRONLY | O_CREAT | O_CLOEXEC, 0644);
    if (fd < 0) {
      std::perror(name.c_str());
      std::exit(1);
    }
    close(fd);
  }

  std::string path_;
};

const table_directory &directory() {
  static const table_directory the_directory;
  return the_directory;
}

void list_tables_ours(benchmark::State &state) {
  sr_opaque_handle_t tree = nullptr;
  if (sr_open_tree_1(&tree, 0, 0) != 0 ||
      sr_mount_local_tree_1(tree, "/disk", directory().path().c_str(), 0) != 0) {
    state.SkipWithError("no tree");
    return;
  }
  for (auto _ : state) {
    char **p_list = nullptr;
    uint32_t count = 0;
    if (sr_list_tables_1(tree, "/disk", &p_list, &count) != 0 || count != Tables) {
      state.SkipWithError("sr_list_tables_1 failed or missed tables");
      break;
    }
    sr_free_table_list_1(p_list, count);
  }
  state.SetItemsProcessed(state.iterations() * Tables);
  sr_close_tree_1(tree);
}

// The floor: every name of the directory read once and looked at.
void list_tables_readdir_floor(benchmark::State &state) {
  const std::string &path = directory().path();
  for (auto _ : state) {
    DIR *p_directory = opendir(path.c_str());
    if (p_directory == nullptr) {
      state.SkipWithError("opendir failed");
      break;
    }
    size_t names = 0;
    while (const struct dirent *p_entry = readdir(p_directory)) {
      names += p_entry->d_name[0] != '\0' ? 1 : 0;
    }
    closedir(p_directory);
    benchmark::DoNotOptimize(names);
  }
  state.SetItemsProcessed(state.iterations() * Tables);
}

}  // namespace

BENCHMARK(list_tables_ours)->Unit(benchmark::kMicrosecond);
BENCHMARK(list_tables_readdir_floor)->Unit(benchmark::kMicrosecond);

BENCHMARK_MAIN();
