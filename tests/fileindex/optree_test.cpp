#include "fileindex/optree/optree.h"

#include <gtest/gtest.h>
#include <pthread.h>
#include <sys/resource.h>

#include <map>
#include <memory>
#include <sstream>
#include <stdexcept>
#include <string>
#include <vector>

#include "common/error.h"
#include "common/json.h"
#include "fileindex/caught.h"
#include "support/naive_tree.h"
#include "support/queue_file.h"
#include "support/temp_folder.h"

namespace vexlo::fileindex {
namespace {

// Lines from a script: "create /a; mkdir+update /d {}; rename /old /new".
std::vector<std::string> Script(const std::string& text) {
  static const std::map<std::string, uint32_t> kVerbs = {
      {"create", 0x40}, {"modify", 0x2},   {"close", 0x8},       {"attrib", 0x4},
      {"delete", 0x80}, {"rename", 0x100}, {"reindex", 0x10000}, {"update", 0x20000},
      {"crash", 0x200}, {"mkdir", 0x40},   {"rmdir", 0x80}};
  std::vector<std::string> lines;
  std::istringstream commands(text);
  for (std::string command; std::getline(commands, command, ';');) {
    std::istringstream words(command);
    std::string verbs, path, path_old, data;
    words >> verbs >> path;
    for (std::string word; words >> word;) {
      (word[0] == '/' ? path_old : data) = word;
    }
    path.swap(path_old.empty() ? path : path_old);
    uint32_t event = 0;
    for (const auto& [verb, bit] : kVerbs) {
      event |= verbs.find(verb) == std::string::npos ? 0 : bit;
    }
    lines.push_back(Line(event, path, path_old, verbs.find("dir") != std::string::npos, data));
  }
  return lines;
}

struct Tree : testing::Test {
  void Put(const std::vector<std::string>& lines) const { WriteText(queue, Join(lines)); }
  const TempFolder folder;
  const std::string queue = folder / "queue";
};

// Every row goes through the tree and through its naive twin, so that each vouches for the other.
TEST_F(Tree, Folds) {
  struct {
    const char *script, *want;
    size_t count;
  } const rows[] = {
      {"delete /a; create /b; create /a", "[02] /a\n[02] /b\n", 2},
      {"delete /a; modify /a", "[01] /a\n", 1},
      {"mkdir /a; rmdir /a; rmdir /b", "[06] /a\n[06] /b\n", 2},
      {"update /a {}; delete /a", "[04] /a, data={}\n[01] /a\n", 2},
      {"create /d/a; delete /d/b/c; rename /x /d/f; delete /dd; reindex /d",
       "[05] /x -> /d/f\n[01] /dd\n[06] /d\n", 5},
      {"create /d; update /d [1]", "[04] /d, data=[1]\n", 1},
      {"create /a; crash /s; create /b", "[07] \n", 1},
      {"modify /a; rename /a /b", "[05] /a -> /b\n[02] /b\n", 3},
      {"rename /a /b; rename /b /c", "[05] /a -> /c\n[05] /b -> /c\n", 2},
      {"create /d/x; delete /d/y; rename /p /d/z; rename /d /e",
       "[02] /e/x\n[01] /d/y\n[05] /p -> /e/z\n[05] /d -> /e\n", 4},
      {"create /a/b/c; rename /a /a/b", "[02] /a/b/b/c\n[05] /a -> /a/b\n", 2},
  };
  for (const auto& row : rows) {
    SCOPED_TRACE(row.script);
    Put(Script(row.script));
    for (const naive::Result& result : {naive::Fold(Script(row.script)), FoldFile(queue)}) {
      EXPECT_EQ(Join(result.delivered), row.want);
      EXPECT_EQ(result.count, row.count);
    }
  }
}

// No file system lets a folder move into itself, but a queue may say so. What was moved must not be
// found and moved again for ever.
TEST_F(Tree, RenameIntoItselfEnds) {
  const auto lines = Script("create /a/x; create /a/b/y; rename /a /a/b/c");
  ASSERT_TRUE(naive::Fold(lines).endless);
  Put(lines);
  const naive::Result result = FoldFile(queue);
  EXPECT_TRUE(result.crashed);
  EXPECT_EQ(result.delivered, std::vector<std::string>{"[07] "});
}

TEST_F(Tree, AReindexCancelsWhatWasPutBelowByHand) {
  Put({});
  OPTree tree(queue);
  const auto child = tree.GetNodeByPath("/a/b");
  for (const int kind : {OP_NONE, OP_DELETE, OP_UPSERT, OP_ATTR, OP_UPDATE_DIRECTORY, OP_RENAME,
                         OP_REINDEX, OP_QUEUE_CRASHED}) {
    child->ops = {std::make_shared<OP>(child, static_cast<FileIndexOP>(kind))};
    const auto parent = tree.GetNodeByPath("/a");
    tree.HandleReindex(parent, std::make_shared<OP>(parent, OP_NONE));
    EXPECT_EQ(child->ops[0]->op, kind == OP_RENAME ? OP_RENAME : OP_NONE) << kind;
  }
}

TEST_F(Tree, BadPathsLeaveTheirNodesAndWalksGoBelowFirst) {
  Put({});
  OPTree tree(queue);
  tree.GetNodeByPath("/a/x/1");
  EXPECT_THROW(tree.GetNodeByPath("/b/z/"), Error);
  tree.GetNodeByPath("/a/y");
  std::string paths;
  const auto visit = [&](const std::shared_ptr<OPNode>& node) {
    paths += node->GetPath() + " ";
    tree.GetNodeByPath("/late");
  };
  tree.TraverseNodeDescendant(tree.root, visit, /*skip_self=*/true);
  EXPECT_EQ(paths, "/a/x/1 /a/x /a/y /a /b/z /b ");
}

TEST_F(Tree, AQueueThatCannotBeOpenedIsAnError) {
  const SyslogCapture quiet;
  EXPECT_EQ(Caught([&] { const OPTree tree(queue); }),
            "502 Failed to open queue, reason=No such file or directory");
}

TEST_F(Tree, CallbackThatThrowsEndsTheDelivery) {
  Put(Script("create /a; create /b; create /c"));
  int calls = 0;
  const auto callback = [&](std::shared_ptr<OP>) {
    if (++calls == 2) {
      throw std::runtime_error("enough");
    }
  };
  EXPECT_THROW(OPTree(queue).ProcessOP(callback), std::runtime_error);
  EXPECT_EQ(calls, 2);
}

TEST_F(Tree, HoldsAPathOfAMillionComponentsOnASmallStack) {
  std::string path(2000000, '/');
  for (size_t i = 1; i < path.size(); i += 2) {
    path[i] = 'a';
  }
  Put({Line(EV_CREATE, path), Line(EV_REINDEX, "/a"), Line(EV_ATTRIB, path)});
  naive::Result result;
  auto fold = [&] { result = FoldFile(queue); };
  pthread_attr_t attributes;
  pthread_t thread;
  pthread_attr_init(&attributes);
  ASSERT_EQ(pthread_attr_setstacksize(&attributes, 256 * 1024), 0);
  const auto run = [](void* function) {
    return (*static_cast<decltype(fold)*>(function))(), function;
  };
  ASSERT_EQ(pthread_create(&thread, &attributes, run, &fold), 0);
  pthread_join(thread, nullptr);
  EXPECT_TRUE(result.delivered == (std::vector<std::string>{"[06] /a", "[03] " + path}));
}

TEST_F(Tree, SkipsALineOf64MiBInBoundedMemory) {
  Put({});
  FILE* const file = fopen(queue.c_str(), "w");
  for (int i = 0; i < 64; ++i) {
    fputs(std::string(1 << 20, 'x').c_str(), file);
  }
  fputs(("\n" + Line(EV_CREATE, "/next") + "\n").c_str(), file);
  ASSERT_EQ(fclose(file), 0);
  const auto fold = [&] {  // In a process of its own, whose peak no other test has raised.
    rusage before{}, after{};
    getrusage(RUSAGE_SELF, &before);
    const naive::Result result = FoldFile(queue);
    getrusage(RUSAGE_SELF, &after);
    const bool delivered = result.delivered == std::vector<std::string>{"[02] /next"};
    _exit(delivered && after.ru_maxrss - before.ru_maxrss < 48 * 1024 ? 0 : 1);
  };
  EXPECT_EXIT(fold(), testing::ExitedWithCode(0), "");
}

}  // namespace
}  // namespace vexlo::fileindex
