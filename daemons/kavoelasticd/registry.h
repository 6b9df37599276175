// Which indexes there are, and where: one JSON file.
#ifndef DAEMONS_KAVOELASTICD_REGISTRY_H_
#define DAEMONS_KAVOELASTICD_REGISTRY_H_

#include <map>
#include <string>

namespace vexlo::elasticd {

enum class State { kActive, kPaused, kDamaged };
// As it is stored and shown.
const char* NameOf(State state);

struct RegistryEntry {
  std::string path;   // The folder.
  std::string token;  // What its database says, too.
  State state = State::kActive;
  std::string move_to;  // While it is being moved: where it stands next, if it stands there.
};

// For one thread at a time. Every change replaces the file whole before it counts, so after a crash
// the file has all of it or nothing.
class Registry {
 public:
  // Reads the file; there are no indexes when it is not there. A file that cannot be understood is
  // renamed to "FILE.damaged-N", with a line in the log. Moves that a crash cut short are settled
  // by where the database stands. Throws Failure kStorage for a file that cannot be read or
  // renamed.
  explicit Registry(std::string file);

  const std::map<std::string, RegistryEntry>& Entries() const { return entries_; }
  const RegistryEntry* Find(const std::string& id) const;
  // The id of the index that is in that folder or on its way there, by whatever name; "" for none.
  std::string OwnerOf(const std::string& path) const;

  // Throw Failure kStorage, and nothing has changed.
  void Put(const std::string& id, const RegistryEntry& entry);
  void Replace(const std::string& id, const std::string& new_id, const RegistryEntry& entry);
  void Remove(const std::string& id);

 private:
  void Load();
  void SettleMoves();
  void Save(std::map<std::string, RegistryEntry> entries);

  const std::string file_;
  std::map<std::string, RegistryEntry> entries_;
};

}  // namespace vexlo::elasticd

#endif  // DAEMONS_KAVOELASTICD_REGISTRY_H_
