#include "support/naive_tree.h"

#include <algorithm>
#include <functional>
#include <memory>
#include <sstream>

#include "common/error.h"
#include "common/json.h"

namespace naive {
namespace {

struct Node;

struct Endless {};

struct Op {
  Node* node;
  int kind;
  std::string path_old;
  Json::Value data;
};
using OpPtr = std::shared_ptr<Op>;

struct Node {
  std::string name;
  Node* parent;
  std::vector<std::shared_ptr<Node>> children;
  std::vector<OpPtr> ops;

  std::string Path() const { return parent == nullptr ? name : parent->Path() + "/" + name; }

  Node* Child(const std::string& wanted) {
    for (const auto& child : children) {
      if (child->name == wanted) {
        return child.get();
      }
    }
    children.push_back(std::make_shared<Node>(Node{wanted, this, {}, {}}));
    return children.back().get();
  }
};

enum Handler { kCreate, kModify, kAttr, kDelete, kReindex, kUpdate };

constexpr int kNewKind[] = {2, 2, 3, 1, 6, 4};

// What meeting a pending operation does, by its kind and the handler: k keeps both; all else drops
// the new one, and a digit turns the pending one into that kind, m merges the new data into it.
constexpr const char* kEffects[] = {"kkkkkk",   // none
                                    "2xxxxx",   // delete
                                    "xxx164",   // upsert
                                    "22x164",   // attr
                                    "xxxk6m",   // update directory
                                    "kkkkkk",   // rename
                                    "xxxkxx",   // reindex
                                    "kkkkkk"};  // crashed

void Merge(Op& op, const Json::Value& incoming) {
  for (const char* key : {"document", "audio", "video", "photo", "basic"}) {
    bool flag = false;
    vexlo::GetJsonValue<bool>(flag, incoming, key, /*required=*/false);
    op.data = op.data.isObject() ? op.data : Json::objectValue;
    op.data[key] = flag || op.data[key] == Json::Value(true);
  }
}

// Every node below `node`, each after those below it; a node's children are listed on entering it.
void Below(Node* node, const std::function<void(Node*)>& fn) {
  const auto children = node->children;
  for (const auto& child : children) {
    Below(child.get(), fn);
    fn(child.get());
  }
}

void Move(const OpPtr& op, Node* from, Node* to) {
  op->node = to;
  from->ops.erase(std::find(from->ops.begin(), from->ops.end(), op));
  to->ops.push_back(op);
}

class Tree {
 public:
  void Insert(const std::string& line) {
    Json::Value json;
    if (!vexlo::JsonFromString(json, line)) {
      throw vexlo::Error(vexlo::ERR_BAD_EVENT, "Malformed event_raw: " + line);
    }
    unsigned int mask = 0;
    bool is_dir = false;
    std::string path, path_old;
    Json::Value data;
    vexlo::GetJsonValue(mask, json, "event", true);
    vexlo::GetJsonValue(is_dir, json, "is_dir", false);
    vexlo::GetJsonValue(path, json, "path", true);
    vexlo::GetJsonValue(path_old, json, "path_old", false);
    vexlo::GetJsonValue(data, json, "data", false);

    Node* node = NodeAt(path);
    const auto op = std::make_shared<Op>(Op{node, 0, "", {}});
    const auto step = [&](unsigned int bits, Handler handler) {
      if ((mask & bits) != 0) {
        Handle(handler, node, op);
      }
    };
    step(0x40, is_dir ? kReindex : kCreate);
    step(0x4, kAttr);
    step(0x2 | 0x8, kModify);
    step(0x80, is_dir ? kReindex : kDelete);
    op->path_old = (mask & 0x100) != 0 ? path_old : "";
    if ((mask & 0x100) != 0) {
      Rename(node, op);
    }
    step(0x10000, kReindex);
    op->data = (mask & 0x20000) != 0 ? data : op->data;
    step(0x20000, kUpdate);
    crashed_ = crashed_ || (mask & 0x200) != 0;
  }

  void Deliver(Result& result) {
    result.crashed = crashed_;
    result.count = crashed_ ? 1 : ops_.size();
    if (crashed_) {
      ops_ = {std::make_shared<Op>(Op{&root_, 7, "", {}})};
    }
    for (const OpPtr& op : ops_) {
      if (op->kind == 0) {
        continue;
      }
      const std::string from = op->kind == 5 ? op->path_old + " -> " : "";
      const std::string data = op->kind == 4 ? ", data=" + vexlo::JsonToString(op->data) : "";
      const std::string text = "[0" + std::to_string(op->kind) + "] " + from + op->node->Path();
      result.delivered.push_back(Show(text + data, op->path_old, op->data));
    }
  }

 private:
  Node* NodeAt(const std::string& path) {
    Node* node = &root_;
    std::istringstream stream(path);
    for (std::string component; std::getline(stream, component, '/');) {
      node = component.empty() ? node : node->Child(component);
      if (++steps_ > kMaxSteps) {
        throw Endless{};
      }
    }
    if (node->Path() != path) {
      throw vexlo::Error(vexlo::ERR_INTERNAL, "GetNodeByPath failed, path=" + path);
    }
    return node;
  }

  void Add(const OpPtr& op) {
    if (op->kind != 0) {
      ops_.push_back(op);
      op->node->ops.push_back(op);
    }
  }

  void Handle(Handler handler, Node* node, const OpPtr& op) {
    op->kind = kNewKind[handler];
    const auto pending = node->ops;
    for (const OpPtr& other : pending) {
      const char effect = kEffects[other->kind][handler];
      if (effect == 'm') {
        Merge(*other, Json::Value(op->data));
      } else if (effect < 'a') {
        other->kind = effect - '0';
        other->data = effect == '4' ? op->data : other->data;
      }
      op->kind = effect == 'k' ? op->kind : 0;
    }
    if (handler == kReindex) {
      Below(node, [](Node* below) {
        for (const OpPtr& other : below->ops) {
          other->kind = other->kind == 5 ? 5 : 0;
        }
      });
    }
    Add(op);
  }

  void Rename(Node* node, const OpPtr& op) {
    const std::string old_path = op->path_old;
    const std::string new_path = node->Path();
    Node* source = NodeAt(old_path);
    const auto carry = std::make_shared<Op>(Op{node, 0, "", {}});
    op->kind = 5;
    for (const OpPtr& other : node->ops) {
      other->kind = other->kind >= 1 && other->kind <= 3 ? 0 : other->kind;
    }
    const auto pending = source->ops;
    for (const OpPtr& other : pending) {
      if (other->kind == 2 || other->kind == 3 || other->kind == 6) {
        carry->kind = other->kind;
        other->kind = 0;
      }
      Move(other, source, node);
    }
    Below(source, [&](Node* below) {
      Node* target = NodeAt(new_path + below->Path().substr(old_path.size()));
      const auto moving = below->ops;
      for (const OpPtr& other : moving) {
        if (other->kind >= 2) {
          Move(other, below, target);
        }
      }
    });
    Add(op);
    Add(carry);
  }

  bool crashed_ = false;
  size_t steps_ = 0;
  Node root_{"", nullptr, {}, {}};
  std::vector<OpPtr> ops_;
};

}  // namespace

Result Fold(const std::vector<std::string>& lines) {
  Result result;
  Tree tree;
  for (const std::string& line : lines) {
    try {
      tree.Insert(line);
    } catch (const vexlo::Error& error) {
      const std::string code = std::to_string(error.GetErrorCode());
      const std::string text = "event_raw=" + line + ", code=" + code + ", reason=" + error.what();
      result.skipped.emplace_back(text.c_str());
    } catch (const Endless&) {
      result.endless = true;
      return result;
    }
  }
  tree.Deliver(result);
  return result;
}

std::string Show(std::string printed, const std::string& path_old, const Json::Value& data) {
  const char kind = printed.at(2);
  printed += kind == '5' || path_old.empty() ? "" : " (path_old=" + path_old + ")";
  printed += kind == '4' || data.isNull() ? "" : " (data=" + vexlo::JsonToString(data) + ")";
  return printed;
}

}  // namespace naive
