// HTML by libxml2.
#include <libxml/HTMLparser.h>

#include <algorithm>
#include <exception>
#include <iterator>
#include <memory>
#include <optional>

#include "daemons/kavocontentextractd/fault.h"
#include "daemons/kavocontentextractd/formats.h"
#include "daemons/kavocontentextractd/plain_text.h"
#include "fileindex/elastic_control/schema.h"
#include "kavo/local/content.h"

namespace vexlo::extractd {
namespace {

namespace field = fileindex::elastic::field;

constexpr size_t kMostBytes = size_t{32} << 20;
constexpr size_t kPartBytes = size_t{64} << 10;
// How far into a page its encoding may be told.
constexpr size_t kHeadBytes = size_t{4} << 10;

// Elements between whose texts a word does not go on.
constexpr std::string_view kBlocks[] = {
    "address", "article",  "aside",      "blockquote", "br",   "caption", "dd",    "div", "dl",
    "dt",      "fieldset", "figcaption", "footer",     "form", "h1",      "h2",    "h3",  "h4",
    "h5",      "h6",       "header",     "hr",         "li",   "main",    "nav",   "ol",  "option",
    "p",       "pre",      "section",    "table",      "td",   "th",      "title", "tr",  "ul"};
constexpr std::string_view kCells[] = {"option", "td", "th"};
constexpr std::string_view kHidden[] = {"noscript", "object", "script", "style", "svg", "template"};

template <size_t N>
bool IsOneOf(const std::string_view (&names)[N], std::string_view name) {
  return std::find(std::begin(names), std::end(names), name) != std::end(names);
}

std::string_view TextOf(const xmlChar* text) {
  return text == nullptr ? std::string_view() : reinterpret_cast<const char*>(text);
}

struct Page {
  Document& document;
  bool is_whole;  // Its title and author are those of the document.
  int hidden = 0;
  bool is_title = false;
  Text title;
  std::exception_ptr thrown;

  static Page& Of(void* data) { return *static_cast<Page*>(data); }

  // An exception must not pass through the C library.
  template <typename Body>
  void Guard(Body body) noexcept {
    try {
      if (!thrown) {
        body();
      }
    } catch (...) {
      thrown = std::current_exception();
    }
  }

  void Break(std::string_view name) {
    if (IsOneOf(kCells, name)) {
      document.text.EndWord();
    } else if (IsOneOf(kBlocks, name)) {
      document.text.EndLine();
    }
  }

  void Meta(const xmlChar** attributes) {
    std::string name;
    std::string_view content;
    for (; attributes != nullptr && attributes[0] != nullptr; attributes += 2) {
      const std::string_view key = TextOf(attributes[0]);
      if (key == "name") {
        name = TextOf(attributes[1]);
      } else if (key == "content") {
        content = TextOf(attributes[1]);
      }
    }
    std::transform(name.begin(), name.end(), name.begin(),
                   [](char c) { return c >= 'A' && c <= 'Z' ? static_cast<char>(c + 32) : c; });
    if (name == "author") {
      document.AddText(field::KAVOMDAuthors, content);
    } else if (name == "description") {
      document.SetText(field::KAVOMDDescription, content);
    } else if (name == "keywords") {
      document.SetText(field::KAVOMDKeywords, content);
    }
  }

  static void Start(void* data, const xmlChar* element, const xmlChar** attributes) noexcept {
    Page& page = Of(data);
    page.Guard([&] {
      const std::string_view name = TextOf(element);
      page.hidden += IsOneOf(kHidden, name) ? 1 : 0;
      page.is_title = page.hidden == 0 && name == "title";
      page.Break(name);
      if (page.is_whole && name == "meta") {
        page.Meta(attributes);
      }
    });
  }
  static void End(void* data, const xmlChar* element) noexcept {
    Page& page = Of(data);
    page.Guard([&] {
      const std::string_view name = TextOf(element);
      page.hidden -= IsOneOf(kHidden, name) && page.hidden > 0 ? 1 : 0;
      page.is_title = false;
      page.Break(name);
    });
  }
  static void Characters(void* data, const xmlChar* text, int size) noexcept {
    Page& page = Of(data);
    page.Guard([&] {
      if (page.hidden > 0) {
        return;
      }
      const std::string_view part(reinterpret_cast<const char*>(text), static_cast<size_t>(size));
      if (page.is_title) {
        AddWords(part, page.title);
      }
      AddWords(part, page.document.text);
    });
  }

  // White space of the source is only what stands between words.
  static void AddWords(std::string_view part, Text& text) {
    constexpr std::string_view kSpace = " \t\r\n\f";
    while (!part.empty()) {
      const size_t word = std::min(part.find_first_of(kSpace), part.size());
      text.Append(part.substr(0, word));
      part.remove_prefix(word);
      const size_t space = std::min(part.find_first_not_of(kSpace), part.size());
      if (space > 0) {
        text.EndWord();
      }
      part.remove_prefix(space);
    }
  }
};

// Whether the page says by itself what encoding it has.
bool TellsEncoding(const std::string& html) {
  std::string head = html.substr(0, kHeadBytes);
  std::transform(head.begin(), head.end(), head.begin(),
                 [](char c) { return c >= 'A' && c <= 'Z' ? static_cast<char>(c + 32) : c; });
  return head.find("charset=") != std::string::npos || head.find("encoding=") != std::string::npos;
}

// The bytes as UTF-8, unless the page says what it is.
std::optional<std::string> AsUtf8(const std::string& html, bool has_more) {
  if (!html.starts_with("\xFF\xFE") && !html.starts_with("\xFE\xFF")) {
    if (IsUtf8(html, has_more)) {
      return html;
    }
    if (TellsEncoding(html)) {
      return std::nullopt;
    }
  }
  return DecodeText(html, has_more);
}

}  // namespace

void AddHtml(const std::string& html, bool is_whole, Document& document) {
  const std::optional<std::string> utf8 = AsUtf8(html, /*has_more=*/html.size() >= kMostBytes);
  const std::string& text = utf8 ? *utf8 : html;
  xmlSAXHandler sax{};
  sax.startElement = Page::Start;
  sax.endElement = Page::End;
  sax.characters = Page::Characters;
  sax.cdataBlock = Page::Characters;
  sax.ignorableWhitespace = Page::Characters;
  Page page{document, is_whole, 0, false, {}, nullptr};
  const std::unique_ptr<htmlParserCtxt, void (*)(htmlParserCtxtPtr)> parser(
      htmlCreatePushParserCtxt(&sax, &page, nullptr, 0, nullptr,
                               utf8 ? XML_CHAR_ENCODING_UTF8 : XML_CHAR_ENCODING_NONE),
      htmlFreeParserCtxt);
  if (parser == nullptr) {
    throw std::bad_alloc();
  }
  htmlCtxtUseOptions(parser.get(), HTML_PARSE_RECOVER | HTML_PARSE_NONET | HTML_PARSE_NOERROR |
                                       HTML_PARSE_NOWARNING | (utf8 ? HTML_PARSE_IGNORE_ENC : 0));
  for (size_t at = 0; at < text.size() && !document.text.IsFull(); at += kPartBytes) {
    const size_t size = std::min(kPartBytes, text.size() - at);
    htmlParseChunk(parser.get(), text.data() + at, static_cast<int>(size), /*terminate=*/0);
  }
  htmlParseChunk(parser.get(), nullptr, 0, /*terminate=*/1);
  if (page.thrown) {
    std::rethrow_exception(page.thrown);
  }
  if (is_whole) {
    document.SetText(field::KAVOMDTitle, page.title.Get());
  }
  document.text.EndLine();
}

void ReadHtml(const Source& source, const std::string& /*type*/, Document& document) {
  AddHtml(source.Read(kMostBytes), /*is_whole=*/true, document);
  if (source.Size() > kMostBytes) {
    document.text.SetTruncated();
  }
}

}  // namespace vexlo::extractd
