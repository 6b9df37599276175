// Pending operations and the nodes that hold them.
#ifndef FILEINDEX_OPTREE_OP_H_
#define FILEINDEX_OPTREE_OP_H_

#include <json/value.h>

#include <cstddef>
#include <cstdint>
#include <functional>
#include <iosfwd>
#include <memory>
#include <string>
#include <string_view>
#include <vector>

#include "common/export.h"

namespace vexlo::fileindex {

class ChildIndex;
class OPNode;

// What is to be done to a path. Printed as numbers: never renumber.
enum FileIndexOP : int32_t {
  OP_NONE = 0,              // Cancelled; never delivered.
  OP_DELETE = 1,            // Remove the path's document.
  OP_UPSERT = 2,            // Index the file's content and metadata.
  OP_ATTR = 3,              // Update the attributes alone.
  OP_UPDATE_DIRECTORY = 4,  // A folder's settings changed; `data` holds its flags.
  OP_RENAME = 5,            // The object moved from `path_old` to the node's path.
  OP_REINDEX = 6,           // Index the path and everything below it again.
  OP_QUEUE_CRASHED = 7,     // Events were lost; rebuild the whole share. Only on the root.
};

// One pending operation. Its node owns it, it refers to the node weakly.
struct VEXLO_EXPORT OP {
  // The node is kept weakly and may be null; nothing is added to it.
  OP(std::shared_ptr<OPNode> node, FileIndexOP op, const std::string& path_old,
     const Json::Value& data);
  // Without a path and a payload.
  OP(std::weak_ptr<OPNode> node, FileIndexOP op);

  // Sets each of "document", "audio", "video", "photo" and "basic" of `data` to whether it is true
  // here (a JSON true; anything else is false) or in `data` (anything that converts to true). Other
  // members of the argument are dropped. Throws Error 120 when the argument is no object; `data`
  // is unchanged then.
  void MergeData(const Json::Value& incoming);

  std::weak_ptr<OPNode> node;  // Lives as long as its tree.
  FileIndexOP op;              // OP_NONE once it is cancelled.
  std::string path_old;        // For a rename; else empty.
  Json::Value data;            // Null unless the event carried a payload.
};

// One path component in the tree that mirrors the folders; the root's name is empty. Nodes are made
// as std::shared_ptr. A node owns its children and operations and knows its parent weakly. Deep
// trees are torn down without recursion.
class VEXLO_EXPORT OPNode : public std::enable_shared_from_this<OPNode> {
 public:
  // A null parent is for a root. The parent is not told: children are made by GetChild().
  OPNode(std::shared_ptr<OPNode> parent, const std::string& name);
  OPNode(std::weak_ptr<OPNode> parent, std::string_view name);
  ~OPNode();
  OPNode(const OPNode&) = delete;
  OPNode& operator=(const OPNode&) = delete;

  // The names from the root down, joined by "/": "/volume1/s/a"; "" for the root itself.
  std::string GetPath() const;

  // The first child of that name, made at the end of `children` when there is none. Constant time
  // on average, also among a million children.
  std::shared_ptr<OPNode> GetChild(const std::string& name);

  // Calls `fn` on each operation that is pending when the call begins, in order. `fn` may change
  // them and append to `ops`; what it appends is not visited.
  void TraverseOP(std::function<void(std::shared_ptr<OP>)> fn);

  std::string name;                               // One component of a path, without "/".
  std::weak_ptr<OPNode> parent;                   // Empty for the root.
  std::vector<std::shared_ptr<OPNode>> children;  // In order of creation.
  std::vector<std::shared_ptr<OP>> ops;           // In order of insertion.

 private:
  friend class OPTree;

  static constexpr uint32_t kPositionBits = (uint32_t{1} << 29) - 1;

  // `hash` is the name's NameHash(). Null when there is none.
  OPNode* FindChild(std::string_view child_name, uint64_t hash);
  OPNode& FindOrAddChild(std::string_view child_name, uint64_t hash);

  std::unique_ptr<ChildIndex> index_;  // Of a node with many children; null otherwise.
  // In the parent's `children`, as GetChild() put it there. One that does not fit is a wrong one,
  // which callers reckon with.
  uint32_t position_ : 29 = 0;
  uint32_t marks_ : 3 = 0;    // Bits of OPTree::Mark.
  uint32_t settled_ops_ = 0;  // That many at the front of `ops` concern no rule any more.
};

// "[02] /volume1/s/a", "[05] OLD -> NEW" for a rename, with ", data=JSON" for a folder update.
// Nothing for an operation whose node is gone. The stream's fill and width are left as they were.
VEXLO_EXPORT std::ostream& operator<<(std::ostream& out, std::shared_ptr<OP> op);

// "Node[NAME]: " and then a line for each operation of the node.
VEXLO_EXPORT std::ostream& operator<<(std::ostream& out, std::shared_ptr<OPNode> node);

}  // namespace vexlo::fileindex

#endif  // FILEINDEX_OPTREE_OP_H_
