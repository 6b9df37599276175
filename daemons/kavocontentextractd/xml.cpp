#include "daemons/kavocontentextractd/xml.h"

#include <expat.h>

#include <exception>
#include <new>
#include <string>

#include "daemons/kavocontentextractd/fault.h"
#include "kavo/local/content.h"

namespace vexlo::extractd {

namespace reason = kavo::local::content_reason;

namespace {

std::string_view LocalName(const char* name) {
  const std::string_view all(name);
  return all.substr(all.find(':') + 1);  // npos + 1 is 0.
}

}  // namespace

// An exception must not pass through the C library: it waits here until that has returned.
struct XmlReader::State {
  XmlHandler& handler;
  XML_Parser parser;
  std::exception_ptr thrown;

  template <typename Body>
  void Guard(Body body) noexcept {
    if (thrown) {
      return;
    }
    try {
      body();
    } catch (...) {
      thrown = std::current_exception();
      XML_StopParser(parser, XML_FALSE);
    }
  }
  static State& Of(void* data) { return *static_cast<State*>(data); }

  static void XMLCALL Start(void* data, const char* name, const char** attributes) noexcept {
    State& state = Of(data);
    state.Guard([&] { state.handler.Start(LocalName(name), XmlHandler::Attributes(attributes)); });
  }
  static void XMLCALL End(void* data, const char* name) noexcept {
    State& state = Of(data);
    state.Guard([&] { state.handler.End(LocalName(name)); });
  }
  static void XMLCALL Characters(void* data, const char* text, int size) noexcept {
    State& state = Of(data);
    state.Guard([&] { state.handler.Characters({text, static_cast<size_t>(size)}); });
  }
  static void XMLCALL Entity(void* data, const char* /*name*/, int /*is_parameter*/,
                             const char* /*value*/, int /*length*/, const char* /*base*/,
                             const char* /*system*/, const char* /*public_id*/,
                             const char* /*notation*/) noexcept {
    State& state = Of(data);
    state.Guard([] { throw Fault(reason::kDamaged, "the XML declares entities"); });
  }
};

std::string_view XmlHandler::Attributes::Get(std::string_view name) const {
  for (const char** pair = pairs_; *pair != nullptr; pair += 2) {
    if (LocalName(pair[0]) == name) {
      return pair[1];
    }
  }
  return {};
}

XmlReader::XmlReader(XmlHandler& handler)
    : parser_(XML_ParserCreate(nullptr), XML_ParserFree),
      state_(new State{handler, parser_.get(), nullptr}) {
  if (parser_ == nullptr) {
    throw std::bad_alloc();
  }
  XML_SetUserData(parser_.get(), state_.get());
  XML_SetElementHandler(parser_.get(), State::Start, State::End);
  XML_SetCharacterDataHandler(parser_.get(), State::Characters);
  XML_SetEntityDeclHandler(parser_.get(), State::Entity);
}

XmlReader::~XmlReader() = default;

void XmlReader::Feed(std::string_view part, bool is_last) {
  const XML_Status status = XML_Parse(parser_.get(), part.data(), static_cast<int>(part.size()),
                                      static_cast<int>(is_last));
  if (state_->thrown) {
    std::rethrow_exception(state_->thrown);
  }
  if (status == XML_STATUS_ERROR) {
    const XML_Error error = XML_GetErrorCode(parser_.get());
    if (error == XML_ERROR_NO_MEMORY) {
      throw std::bad_alloc();
    }
    throw Fault(reason::kDamaged, "the XML cannot be read, " + std::string(XML_ErrorString(error)) +
                                      " in line " +
                                      std::to_string(XML_GetCurrentLineNumber(parser_.get())));
  }
}

}  // namespace vexlo::extractd
