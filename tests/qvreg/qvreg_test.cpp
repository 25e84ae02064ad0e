// qvreg, the built program, run as a process: each subcommand on a
// realistic table, the three output formats, CSV and JSON round trips,
// usage errors (exit 2), the library's refusals (exit 1, its message on
// standard error), input that must change nothing, and a dump taken while
// another process commits.

#include <fcntl.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>
#include <nlohmann/json.hpp>

#include <atomic>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <map>
#include <set>
#include <string>
#include <vector>

#include "qv_sr.h"

namespace {

using json = nlohmann::json;

struct result {
  int exit_code = -1;
  std::string out;
  std::string err;
};

std::string read_all(int fd) {
  std::string text;
  char buffer[4096];
  for (ssize_t got; (got = read(fd, buffer, sizeof buffer)) > 0;) {
    text.append(buffer, static_cast<size_t>(got));
  }
  return text;
}

class Qvreg : public ::testing::Test {
 protected:
  void SetUp() override {
    std::string pattern = (std::filesystem::temp_directory_path() / "qvreg_test_XXXXXX").string();
    ASSERT_NE(mkdtemp(pattern.data()), nullptr);
    directory_ = pattern;
    registry_ = directory_ + "/registry";
  }
  void TearDown() override { std::filesystem::remove_all(directory_); }

  // Runs qvreg with `arguments`, the registry in the test's directory.
  result run(const std::vector<std::string> &arguments) const {
    const std::string out_file = directory_ + "/out", err_file = directory_ + "/err";
    const pid_t child = fork();
    if (child == 0) {
      const int out = open(out_file.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0644);
      const int err = open(err_file.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0644);
      dup2(out, 1);
      dup2(err, 2);
      setenv("QV_REGISTRY", registry_.c_str(), 1);
      std::vector<char *> argv{const_cast<char *>(QVREG_PROGRAM)};
      for (const std::string &argument : arguments) {
        argv.push_back(const_cast<char *>(argument.c_str()));
      }
      argv.push_back(nullptr);
      execv(QVREG_PROGRAM, argv.data());
      _exit(127);
    }
    int status = 0;
    waitpid(child, &status, 0);
    result done;
    done.exit_code = WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status);
    const int out = open(out_file.c_str(), O_RDONLY);
    const int err = open(err_file.c_str(), O_RDONLY);
    done.out = read_all(out);
    done.err = read_all(err);
    close(out);
    close(err);
    return done;
  }

  // Runs and expects success; the standard output.
  std::string ok(const std::vector<std::string> &arguments) const {
    const result done = run(arguments);
    EXPECT_EQ(done.exit_code, 0) << "qvreg " << arguments.front() << ": " << done.err;
    return done.out;
  }

  json rows_of(const std::string &table) const {
    return json::parse(ok({"--format", "json", "dump", table}));
  }

  // /local/services: name (key), port (int32, default 80), ratio (float64),
  // tags (string array), blob (binary).
  void create_services() const {
    ok({"create", "/local/services", "name:string:key", "port:int32=80", "ratio:float64",
        "tags:string_array", "blob:binary"});
    ok({"add", "/local/services", "name=web", "port=8080", "ratio=0.5", R"(tags=["a","b"])",
        "blob=0aff"});
    ok({"add", "/local/services", "name=db", "ratio=1.25", "tags=[]"});
    ok({"add", "/local/services", "name=cache, \"hot\"", "port=6379"});
  }

  std::string directory_;
  std::string registry_;
};

TEST_F(Qvreg, RowsAreAddedReadChangedAndDeletedInEveryFormat) {
  create_services();
  const json rows = rows_of("/local/services");
  ASSERT_EQ(rows.size(), 3u);
  EXPECT_EQ(rows[0], (json{{"name", "web"},
                           {"port", 8080},
                           {"ratio", 0.5},
                           {"tags", {"a", "b"}},
                           {"blob", "0aff"}}));
  EXPECT_EQ(rows[1]["port"], 80);  // the default
  EXPECT_EQ(rows[2]["name"], "cache, \"hot\"");

  const std::string table = ok({"get", "/local/services", "web", "port", "tags"});
  EXPECT_EQ(table, "port  tags\n----  ---------\n8080  [\"a\",\"b\"]\n");
  const std::string csv = ok({"--format", "csv", "get", "/local/services", "cache, \"hot\""});
  EXPECT_EQ(csv.substr(0, csv.find("\r\n")), "name,port,ratio,tags,blob");
  EXPECT_NE(csv.find("\"cache, \"\"hot\"\"\",6379"), std::string::npos) << csv;

  ok({"set", "/local/services", "db", "port=5432", "ratio=2"});
  EXPECT_EQ(rows_of("/local/services")[1]["port"], 5432);
  const json selected = json::parse(ok({"--format", "json", "select", "/local/services", "--where",
                                        "port > 1000", "--columns", "port"}));
  EXPECT_EQ(selected, json::parse(R"([{"name":"web","port":8080},{"name":"db","port":5432},
                                      {"name":"cache, \"hot\"","port":6379}])"));
  ok({"delete", "/local/services", "web"});
  ok({"delete", "/local/services", "--where", "port == 5432"});
  const json left = rows_of("/local/services");
  ASSERT_EQ(left.size(), 1u);
  EXPECT_EQ(left[0]["name"], "cache, \"hot\"");
}

TEST_F(Qvreg, ExportedRowsImportIntoANewTableUnchangedAsCsvAndJson) {
  create_services();
  for (const std::string format : {"csv", "json"}) {
    const std::string copy = "/local/copy_" + format;
    ok({"create", copy, "name:string:key", "port:int32=80", "ratio:float64", "tags:string_array",
        "blob:binary"});
    const std::string file = directory_ + "/rows." + format;
    std::ofstream(file) << ok({"export", "/local/services", "--format", format});
    ok({"import", copy, file});
    EXPECT_EQ(rows_of(copy), rows_of("/local/services")) << format;
  }
}

TEST_F(Qvreg, SchemaChangesAndTablesAreShownCopiedMovedAndRemoved) {
  create_services();
  ok({"add-column", "/local/services", "owner:string=nobody"});
  ok({"rename-column", "/local/services", "ratio", "weight"});
  ok({"drop-column", "/local/services", "blob"});
  const json schema = json::parse(ok({"--format", "json", "schema", "/local/services"}));
  ASSERT_EQ(schema.size(), 5u);
  EXPECT_EQ(schema[0], (json{{"column", "name"},
                             {"type", "string"},
                             {"qualifier", "key"},
                             {"default", ""},
                             {"fields", nullptr}}));
  EXPECT_EQ(schema[2]["column"], "weight");
  EXPECT_EQ(schema[4], (json{{"column", "owner"},
                             {"type", "string"},
                             {"qualifier", "standard"},
                             {"default", "nobody"},
                             {"fields", nullptr}}));
  EXPECT_EQ(rows_of("/local/services")[0]["owner"], "nobody");

  ok({"cp", "/local/services", "/local/backup"});
  EXPECT_EQ(run({"cp", "/local/services", "/local/backup"}).exit_code, 1);
  ok({"cp", "--overwrite", "/local/services", "/local/backup"});
  ok({"mv", "/local/backup", "/local/archive/old"});
  EXPECT_TRUE(std::filesystem::exists(registry_ + "/archive,old"));
  const json listed = json::parse(ok({"--format", "json", "ls", "/local"}));
  ASSERT_EQ(listed.size(), 2u);
  for (const json &entry : listed) {
    EXPECT_EQ(entry["storage"], "file");
    EXPECT_EQ(entry["rows"], 3);
    EXPECT_GT(entry["bytes"].get<int64_t>(), 0);
  }
  ok({"rm", "/local/archive/old"});
  EXPECT_FALSE(std::filesystem::exists(registry_ + "/archive,old"));

  ok({"set", "/local/services", "web", "port=1"});  // appended: the old record is dead
  const json stat = json::parse(ok({"--format", "json", "stat", "/local/services"}));
  std::map<std::string, json> facts;
  for (const json &fact : stat) {
    facts[fact["property"]] = fact["value"];
  }
  EXPECT_EQ(facts["rows"], 3);
  EXPECT_EQ(facts["side_file"], false);
  EXPECT_EQ(facts["file_bytes"].get<int64_t>(),
            static_cast<int64_t>(std::filesystem::file_size(registry_ + "/services")));
  EXPECT_EQ(facts["live_bytes"].get<int64_t>() + facts["dead_bytes"].get<int64_t>(),
            facts["file_bytes"].get<int64_t>());
  EXPECT_GT(facts["dead_bytes"].get<int64_t>(), 0);  // the deleted and replaced records

  const std::string internals = ok({"dump", "--internals", "/local/services"});
  EXPECT_NE(internals.find("state(committed)"), std::string::npos) << internals;
  std::ofstream(registry_ + "/services.rewrite") << "left by a crash";
  ok({"repair", "/local/services"});
  EXPECT_FALSE(std::filesystem::exists(registry_ + "/services.rewrite"));
}

TEST_F(Qvreg, StructuredDataColumnsAreDefinedWrittenAndReadAsObjects) {
  ok({"create", "/local/places", "id:uint64:key", R"(where:sd(x=int32,label=string))",
      R"(route:sd_array(x=int32,label=string)=[])", "handle:resource_handle"});
  ok({"add", "/local/places", "id=18446744073709551615", R"(where={"x":-3,"label":"dock"})",
      R"(route=[{"x":1,"label":"a"},{"x":2,"label":"b"}])",
      "handle=00010002:0000000a.0000000b.0000000c.0000000d"});
  EXPECT_EQ(rows_of("/local/places"), json::parse(R"([{"id":18446744073709551615,
      "where":{"x":-3,"label":"dock"},
      "route":[{"x":1,"label":"a"},{"x":2,"label":"b"}],
      "handle":"00010002:0000000a.0000000b.0000000c.0000000d"}])"));
  const json schema = json::parse(ok({"--format", "json", "schema", "/local/places"}));
  EXPECT_EQ(schema[1]["fields"], (json{"x:int32", "label:string"}));
  const result missing_field = run({"add", "/local/places", "id=1", R"(where={"x":1})"});
  EXPECT_EQ(missing_field.exit_code, 2);
  EXPECT_NE(missing_field.err.find("field \"label\" missing"), std::string::npos)
      << missing_field.err;
  EXPECT_EQ(run({"create", "/local/bad", "id:int32:key", "s:sd(x=nothing)"}).exit_code, 2);
}

TEST_F(Qvreg, PackedBuffersAreWrittenAndTheirTablesShown) {
  create_services();
  ok({"create", "/local/hosts", "id:int32:key", "address:string"});
  ok({"add", "/local/hosts", "id=1", "address=10.0.0.1"});
  const std::string file = directory_ + "/tables.pack";
  ok({"pack", "/local/services", "/local/hosts", "-o", file});
  const json contents = json::parse(ok({"--format", "json", "unpack", file}));
  EXPECT_EQ(contents, json::parse(R"([
      {"index":0,"table":"/local/services","rows":3,"columns":5,"change_counter":4},
      {"index":1,"table":"/local/hosts","rows":1,"columns":2,"change_counter":2}])"));
  // A damaged header is refused by the library; a file shorter than the
  // length it states is refused before the library reads it.
  std::string bytes{std::istreambuf_iterator<char>(std::ifstream(file, std::ios::binary).rdbuf()),
                    std::istreambuf_iterator<char>()};
  bytes[4] = 0x7f;  // the format's version
  std::ofstream(file, std::ios::binary | std::ios::trunc) << bytes;
  const result damaged = run({"unpack", file});
  EXPECT_EQ(damaged.exit_code, 1);
  EXPECT_EQ(damaged.err, "2605-014 The table is unreadable.\n");
  std::ofstream(file, std::ios::binary | std::ios::trunc) << bytes.substr(0, 100);
  const result short_file = run({"unpack", file});
  EXPECT_EQ(short_file.exit_code, 1);
  EXPECT_EQ(short_file.err, file + " is shorter than the buffer it holds\n");
}

TEST_F(Qvreg, UsageErrorsExitWithTwoAndChangeNothing) {
  create_services();
  const json before = rows_of("/local/services");
  const result bad_type = run({"set", "/local/services", "web", "port=eighty"});
  EXPECT_EQ(bad_type.exit_code, 2);
  EXPECT_EQ(bad_type.err, "qvreg: column \"port\" takes a value of type int32, not \"eighty\"\n");
  const result unknown_column = run({"add", "/local/services", "name=x", "colour=red"});
  EXPECT_EQ(unknown_column.exit_code, 2);
  EXPECT_EQ(unknown_column.err, "qvreg: table /local/services has no column \"colour\"\n");
  EXPECT_EQ(run({"frobnicate"}).exit_code, 2);
  EXPECT_EQ(run({"get", "/local/services"}).exit_code, 2);
  EXPECT_EQ(run({"--format", "xml", "dump", "/local/services"}).exit_code, 2);
  EXPECT_EQ(run({"--mount", "nodirectory", "ls"}).exit_code, 2);
  EXPECT_EQ(run({"select", "/local/services", "--where", "port > $i"}).exit_code, 2);
  EXPECT_EQ(run({"delete", "/local/services"}).exit_code, 2);
  EXPECT_EQ(run({"create", "/local/t", "name"}).exit_code, 2);
  EXPECT_EQ(rows_of("/local/services"), before);
  EXPECT_EQ(run({"help"}).exit_code, 0);
  EXPECT_EQ(run({"dump", "--help"}).exit_code, 0);
}

TEST_F(Qvreg, RefusalsExitWithOneShowTheLibrarysMessageAndChangeNothing) {
  create_services();
  const json before = rows_of("/local/services");
  const result missing = run({"dump", "/local/none"});
  EXPECT_EQ(missing.exit_code, 1);
  EXPECT_EQ(missing.err, "2605-200 The table does not exist.\n");
  const result bad_path = run({"dump", "/local/bad path"});
  EXPECT_EQ(bad_path.exit_code, 1);
  EXPECT_TRUE(bad_path.err.starts_with("2605-102 ")) << bad_path.err;
  EXPECT_EQ(run({"add", "/local/services", "name=web"}).exit_code, 1);  // the key exists
  // An import is one transaction: a bad row at the end adds none of them.
  const std::string file = directory_ + "/rows.csv";
  std::ofstream(file) << "name,port\r\nnew1,1\r\nweb,2\r\n";
  EXPECT_EQ(run({"import", "/local/services", file}).exit_code, 1);
  EXPECT_EQ(rows_of("/local/services"), before);
  std::ofstream(registry_ + "/corrupt") << "this is no table";
  const result corrupt = run({"dump", "/local/corrupt"});
  EXPECT_EQ(corrupt.exit_code, 1);
  EXPECT_EQ(corrupt.err, "2605-014 The table is unreadable.\n");
}

// A writer commits transactions that set every row's port to one number;
// every dump, taken meanwhile by another process, shows one number.
TEST_F(Qvreg, ADumpDuringCommitsShowsOneCommittedState) {
  ok({"create", "/local/t", "id:int32:key", "port:int32"});
  for (int id = 0; id < 50; ++id) {
    ok({"add", "/local/t", "id=" + std::to_string(id), "port=0"});
  }
  const pid_t writer = fork();
  if (writer == 0) {
    sr_opaque_handle_t tree = nullptr;
    sr_opaque_handle_t table = nullptr;
    if (sr_open_tree_1(&tree, 0, 0) != 0 ||
        sr_mount_local_tree_1(tree, "/local", registry_.c_str(), 0) != 0 ||
        sr_open_table_1(tree, "/local/t", SR_MODE_WRITE_EXPLICIT, &table) != 0) {
      _exit(2);
    }
    for (int32_t round = 1;; ++round) {
      for (int32_t id = 0; id < 50; ++id) {
        qv_value_t key{}, port{};
        key.val_int32 = id;
        port.val_int32 = round;
        if (sr_set_field_by_key_1(table, key, "port", &port) != 0) {
          _exit(3);
        }
      }
      if (sr_apply_1(table, 0) != 0 || sr_commit_1(table) != 0) {
        _exit(4);
      }
    }
  }
  std::set<int> rounds_seen;
  for (int dump = 0; dump < 20; ++dump) {
    const json rows = rows_of("/local/t");
    ASSERT_EQ(rows.size(), 50u);
    for (const json &row : rows) {
      ASSERT_EQ(row["port"], rows[0]["port"]) << "dump " << dump << " mixes two commits";
    }
    rounds_seen.insert(rows[0]["port"].get<int>());
  }
  kill(writer, SIGKILL);
  int status = 0;
  waitpid(writer, &status, 0);
  EXPECT_TRUE(WIFSIGNALED(status)) << "the writer stopped by itself: " << status;
  EXPECT_GT(rounds_seen.size(), 1u) << "the writer never committed between dumps";
}

}  // namespace
