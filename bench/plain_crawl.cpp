// A crawl without daemons: reads the files below a folder one after the other and inserts them into
// the tables that an index of the engine has. It looks for no document to replace, sends nothing to
// anybody, and commits every 10,000 files.
//
// usage: plain_crawl TREE FOLDER
//   makes the tables in FOLDER, which must be there, and prints as JSON how many files and folders
//   it took, and the seconds of wall and of processor time for it.
#include <json/value.h>
#include <time.h>

#include <cstdio>
#include <exception>
#include <filesystem>
#include <string>

#include "bench/same_tables.h"
#include "kavo/content_extract.h"

namespace {

constexpr int kCommitEvery = 10000;

double Now(clockid_t clock) {
  struct timespec now {};
  clock_gettime(clock, &now);
  return static_cast<double>(now.tv_sec) + static_cast<double>(now.tv_nsec) / 1e9;
}

Json::Value DocumentOf(const std::string& path) {
  Json::Value options;
  options["need_meta"] = true;
  Json::Value document(Json::objectValue);
  KAVO::CONTENT_EXTRACT::ParseFile(path, options, document);
  document["KAVOMDSearchFileName"] = document["KAVOMDFSName"];
  document["KAVOMDSearchAncestor"] = document["KAVOMDParent"];
  return document;
}

int Crawl(const char* tree, const char* folder) {
  bench::SameTables tables(folder);
  const double wall = Now(CLOCK_MONOTONIC);
  const double cpu = Now(CLOCK_PROCESS_CPUTIME_ID);
  int taken = 0;
  tables.Execute("BEGIN");
  for (const auto& entry : std::filesystem::recursive_directory_iterator(tree)) {
    tables.Insert(tables.Rows(DocumentOf(entry.path())));
    if (++taken % kCommitEvery == 0) {
      tables.Execute("COMMIT; BEGIN");
    }
  }
  tables.Execute("COMMIT");
  printf("{\"taken\":%d,\"seconds\":%.3f,\"cpu\":%.3f}\n", taken, Now(CLOCK_MONOTONIC) - wall,
         Now(CLOCK_PROCESS_CPUTIME_ID) - cpu);
  return 0;
}

}  // namespace

int main(int argc, char** argv) {
  if (argc != 3) {
    fputs("usage: plain_crawl TREE FOLDER\n", stderr);
    return 2;
  }
  try {
    return Crawl(argv[1], argv[2]);
  } catch (const std::exception& error) {
    fprintf(stderr, "plain_crawl: %s\n", error.what());
  } catch (...) {
    fputs("plain_crawl: a file could not be read\n", stderr);
  }
  return 3;
}
