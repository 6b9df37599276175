#include "fileindex/optree/op.h"

#include <cstdio>
#include <ostream>
#include <utility>

#include "common/json.h"
#include "fileindex/optree/child_index.h"
#include "fileindex/optree/name_hash.h"
#include "fileindex/optree/slab.h"

namespace vexlo::fileindex {
namespace {

// From so many children on their list grows by a quarter at a time: by then it is moved rarely, and
// doubled it would be half empty on average.
constexpr size_t kCloseGrowth = 16;

constexpr const char* kCategories[] = {"document", "audio", "video", "photo", "basic"};

// Fetches what the next nodes from the end on lead to, step by step, so that the waits overlap.
void PrefetchDoomed(const std::vector<std::shared_ptr<OPNode>>& doomed) {
  constexpr size_t kNodeAhead = 12;
  constexpr size_t kListAhead = 8;
  constexpr size_t kOpAhead = 4;
  const size_t left = doomed.size();
  if (left <= kNodeAhead) {
    return;
  }
  const OPNode* const node = doomed[left - 1 - kNodeAhead].get();
  __builtin_prefetch(node);
  __builtin_prefetch(&node->ops);
  __builtin_prefetch(doomed[left - 1 - kListAhead]->ops.data());
  if (const auto& ops = doomed[left - 1 - kOpAhead]->ops; !ops.empty()) {
    __builtin_prefetch(ops.front().get());
  }
}

}  // namespace

OP::OP(std::shared_ptr<OPNode> node_in, FileIndexOP op_in, const std::string& path_old_in,
       const Json::Value& data_in)
    : node(node_in), op(op_in), path_old(path_old_in), data(data_in) {}

OP::OP(std::weak_ptr<OPNode> node_in, FileIndexOP op_in) : node(std::move(node_in)), op(op_in) {}

void OP::MergeData(const Json::Value& incoming) {
  Json::Value merged = data.isObject() ? data : Json::Value(Json::objectValue);
  for (const char* category : kCategories) {
    bool flag = false;
    GetJsonValue(flag, incoming, category, /*required=*/false);
    const Json::Value& existing = std::as_const(merged)[category];
    merged[category] = flag || (existing.isBool() && existing.asBool());
  }
  data.swap(merged);
}

OPNode::OPNode(std::shared_ptr<OPNode> parent_in, const std::string& name_in)
    : name(name_in), parent(parent_in) {}

OPNode::OPNode(std::weak_ptr<OPNode> parent_in, std::string_view name_in)
    : name(name_in), parent(std::move(parent_in)) {}

OPNode::~OPNode() {
  // Children are taken apart from a list of their own: a destructor that runs its children's would
  // need stack for every level, and a path may have a million.
  std::vector<std::shared_ptr<OPNode>> doomed;
  doomed.swap(children);
  while (!doomed.empty()) {
    PrefetchDoomed(doomed);
    const std::shared_ptr<OPNode> node = std::move(doomed.back());
    doomed.pop_back();
    if (node.use_count() == 1) {
      for (std::shared_ptr<OPNode>& child : node->children) {
        doomed.push_back(std::move(child));
      }
      node->children.clear();
    }
  }
}

std::string OPNode::GetPath() const {
  size_t length = name.size();
  for (std::shared_ptr<OPNode> above = parent.lock(); above != nullptr;
       above = above->parent.lock()) {
    length += above->name.size() + 1;
  }
  std::string path(length, '/');
  size_t end = length - name.size();
  path.replace(end, name.size(), name);
  for (std::shared_ptr<OPNode> above = parent.lock(); above != nullptr;
       above = above->parent.lock()) {
    end -= above->name.size() + 1;
    path.replace(end, above->name.size(), above->name);
  }
  return path;
}

std::shared_ptr<OPNode> OPNode::GetChild(const std::string& child_name) {
  return FindOrAddChild(child_name, NameHash(child_name)).shared_from_this();
}

OPNode* OPNode::FindChild(std::string_view child_name, uint64_t hash) {
  if (index_ == nullptr) {
    for (const std::shared_ptr<OPNode>& child : children) {
      if (child->name == child_name) {
        return child.get();
      }
    }
    return nullptr;
  }
  return index_->Find(children, child_name, hash);
}

OPNode& OPNode::FindOrAddChild(std::string_view child_name, uint64_t hash) {
  if (OPNode* const found = FindChild(child_name, hash); found != nullptr) {
    return *found;
  }
  if (children.size() == children.capacity() && children.size() >= kCloseGrowth) {
    children.reserve(children.size() + children.size() / 4);
  }
  auto child = std::allocate_shared<OPNode>(SlabAllocator<OPNode>(), weak_from_this(), child_name);
  child->position_ = static_cast<uint32_t>(children.size()) & kPositionBits;
  if (index_ != nullptr) {
    index_->Append(children.size(), hash);
  }
  children.push_back(std::move(child));
  if (index_ == nullptr && children.size() >= ChildIndex::kFewestChildren) {
    index_ = std::make_unique<ChildIndex>();
    for (uint32_t i = 0; i < children.size(); ++i) {
      for (size_t bit = 0; bit < index_->marked.size(); ++bit) {
        if ((children[i]->marks_ >> bit & 1) != 0) {
          index_->marked[bit].Add(i);
        }
      }
    }
  }
  return *children.back();
}

void OPNode::TraverseOP(std::function<void(std::shared_ptr<OP>)> fn) {
  const std::vector<std::shared_ptr<OP>> pending = ops;
  for (const std::shared_ptr<OP>& op : pending) {
    fn(op);
  }
}

std::ostream& operator<<(std::ostream& out, std::shared_ptr<OP> op) {
  const std::shared_ptr<OPNode> node = op->node.lock();
  if (node == nullptr) {
    return out;
  }
  // Built as text first: the kind's padding must not change the stream, nor its width eat the "[".
  char kind[16];
  (void)snprintf(kind, sizeof(kind), "[%02d] ", static_cast<int>(op->op));
  std::string text = kind;
  if (op->op == OP_RENAME) {
    text += op->path_old + " -> ";
  }
  text += node->GetPath();
  if (op->op == OP_UPDATE_DIRECTORY) {
    text += ", data=" + JsonToString(op->data);
  }
  return out.write(text.data(), static_cast<std::streamsize>(text.size()));
}

std::ostream& operator<<(std::ostream& out, std::shared_ptr<OPNode> node) {
  out << "Node[" << node->name << "]: " << std::endl;
  for (const std::shared_ptr<OP>& op : node->ops) {
    out << "  " << op << std::endl;
  }
  return out;
}

}  // namespace vexlo::fileindex
