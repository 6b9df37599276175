// A document of XML as it streams by, without a tree.
#ifndef DAEMONS_KAVOCONTENTEXTRACTD_XML_H_
#define DAEMONS_KAVOCONTENTEXTRACTD_XML_H_

#include <memory>
#include <string_view>

struct XML_ParserStruct;

namespace vexlo::extractd {

// Names of elements and attributes come without their namespace's prefix: "w:t" is "t". The parts
// of a text may come one by one. Entities of the document's own are refused: they are the means to
// make much out of little, and no program writes them.
class XmlHandler {
 public:
  class Attributes {
   public:
    explicit Attributes(const char** pairs) : pairs_(pairs) {}
    // "" for one that is not there.
    std::string_view Get(std::string_view name) const;

   private:
    const char** pairs_;
  };

  XmlHandler() = default;
  virtual ~XmlHandler() = default;
  XmlHandler(const XmlHandler&) = delete;
  XmlHandler& operator=(const XmlHandler&) = delete;

  virtual void Start(std::string_view name, const Attributes& attributes) = 0;
  virtual void End(std::string_view name) = 0;
  virtual void Characters(std::string_view text) = 0;
};

class XmlReader {
 public:
  // The handler outlives the reader.
  explicit XmlReader(XmlHandler& handler);
  ~XmlReader();
  XmlReader(const XmlReader&) = delete;
  XmlReader& operator=(const XmlReader&) = delete;

  // Takes the next part of the document. Throws Fault kDamaged where it is no XML any more, and
  // what the handler throws; the reader is of no use then.
  void Feed(std::string_view part, bool is_last);

 private:
  struct State;
  std::unique_ptr<struct XML_ParserStruct, void (*)(struct XML_ParserStruct*)> parser_;
  std::unique_ptr<State> state_;
};

}  // namespace vexlo::extractd

#endif  // DAEMONS_KAVOCONTENTEXTRACTD_XML_H_
