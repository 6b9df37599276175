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
constexpr size_t kHeadBytes = size_t{64} << 10;

// Elements between whose texts a word does not go on.
constexpr std::string_view kBlocks[] = {
    "address", "article", "aside",     "blockquote", "body",       "br",      "button",   "canvas",
    "caption", "center",  "datalist",  "dd",         "desc",       "details", "dialog",   "dir",
    "div",     "dl",      "dt",        "fieldset",   "figcaption", "figure",  "footer",   "form",
    "h1",      "h2",      "h3",        "h4",         "h5",         "h6",      "head",     "header",
    "hgroup",  "hr",      "iframe",    "input",      "label",      "legend",  "li",       "listing",
    "main",    "marquee", "menu",      "nav",        "noframes",   "ol",      "optgroup", "option",
    "output",  "p",       "plaintext", "pre",        "search",     "section", "select",   "summary",
    "table",   "td",      "text",      "textarea",   "th",         "title",   "tr",       "ul",
    "xmp"};
constexpr std::string_view kCells[] = {"option", "td", "th"};
// An illustrator writes itself a copy into its drawings.
constexpr std::string_view kHidden[] = {"i:pgf",  "metadata", "noscript", "object",
                                        "script", "style",    "svg",      "template"};
constexpr std::string_view kDrawing = "svg";

template <size_t N>
bool IsOneOf(const std::string_view (&names)[N], std::string_view name) {
  return std::find(std::begin(names), std::end(names), name) != std::end(names);
}

std::string_view TextOf(const xmlChar* text) {
  return text == nullptr ? std::string_view() : reinterpret_cast<const char*>(text);
}

std::string_view FindAttribute(const xmlChar** attributes, std::string_view name) {
  for (; attributes != nullptr && attributes[0] != nullptr; attributes += 2) {
    if (TextOf(attributes[0]) == name) {
      return TextOf(attributes[1]);
    }
  }
  return {};
}

struct Page {
  Document& document;
  bool is_whole;    // Its title and author are those of the document.
  bool is_drawing;  // By itself, not one within a page.
  int hidden = 0;
  bool is_title = false;
  Text title;
  std::string line;  // Where the text of a drawing stands, as it says itself.
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

  [[nodiscard]] bool IsHidden(std::string_view name) const {
    return IsOneOf(kHidden, name) && !(is_drawing && name == kDrawing);
  }

  void Break(std::string_view name) {
    if (IsOneOf(kCells, name)) {
      document.text.EndWord();
    } else if (IsOneOf(kBlocks, name)) {
      document.text.EndLine();
    }
  }

  // Programs that set letters one by one put parts of a word into elements of their own.
  void DrawnText(std::string_view name, const xmlChar** attributes) {
    const std::string_view height = FindAttribute(attributes, "y");
    if (name == "text") {
      line = height.empty() ? "0" : height;
    } else if (height.empty() ? !FindAttribute(attributes, "dy").empty() : height != line) {
      document.text.EndLine();
      line = height.empty() ? line : height;
    }
  }

  void Meta(const xmlChar** attributes) {
    std::string name(FindAttribute(attributes, "name"));
    const std::string_view content = FindAttribute(attributes, "content");
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
      page.hidden += page.IsHidden(name) ? 1 : 0;
      // The parts of a drawing have titles, too.
      page.is_title = page.hidden == 0 && name == "title" && page.title.Get().empty();
      page.Break(name);
      if (page.is_drawing && (name == "text" || name == "tspan")) {
        page.DrawnText(name, attributes);
      }
      if (page.is_whole && name == "meta") {
        page.Meta(attributes);
      }
    });
  }
  static void End(void* data, const xmlChar* element) noexcept {
    Page& page = Of(data);
    page.Guard([&] {
      const std::string_view name = TextOf(element);
      page.hidden -= page.IsHidden(name) && page.hidden > 0 ? 1 : 0;
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

// The next tag, without its brackets, taken off the page with all before it. Comments are none.
std::string_view TakeTag(std::string_view& html) {
  html.remove_prefix(std::min(html.find('<'), html.size()));
  while (html.starts_with("<!--")) {
    html.remove_prefix(std::min(html.find("-->"), html.size()));
    html.remove_prefix(std::min(html.find('<'), html.size()));
  }
  const std::string_view tag = html.substr(0, html.find('>'));
  html.remove_prefix(tag.size());
  return tag.substr(std::min<size_t>(tag.size(), 1));
}

// What stands behind the name and "=", be it an attribute or a part of one; "" without it.
std::string_view ValueOf(std::string_view tag, std::string_view name) {
  const auto skip = [&tag](std::string_view bytes) {
    tag.remove_prefix(std::min(tag.find_first_not_of(bytes), tag.size()));
  };
  const size_t at = tag.find(name);
  if (at == std::string_view::npos) {
    return {};
  }
  tag.remove_prefix(at + name.size());
  skip(" \t\r\n");
  if (!tag.starts_with('=')) {
    return {};
  }
  skip("= \t\r\n\"'");
  return tag.substr(0, tag.find_first_of(" \t\r\n\"';/?"));
}

// The encoding that the page says it has, "" without one. UTF-8 shows in the bytes, and in others
// that do not have ASCII's letters nobody could read what the page says.
std::string ToldEncoding(const std::string& html) {
  std::string head = html.substr(0, kHeadBytes);
  std::transform(head.begin(), head.end(), head.begin(),
                 [](char c) { return c >= 'A' && c <= 'Z' ? static_cast<char>(c + 32) : c; });
  std::string_view rest = head;
  while (!rest.empty()) {
    const std::string_view tag = TakeTag(rest);
    const std::string_view label = tag.starts_with("?xml")   ? ValueOf(tag, "encoding")
                                   : tag.starts_with("meta") ? ValueOf(tag, "charset")
                                                             : std::string_view();
    std::string encoding = FindEncoding(std::string(label));
    if (!encoding.empty() && label.find("utf") == std::string::npos &&
        Convert("<", encoding) == "<") {
      return encoding;
    }
  }
  return "";
}

// From the outermost element on, when that is a drawing's; else "". Types do not tell, as pages
// have drawings in them, and what a drawing declares before is nothing that an HTML parser knows.
std::string_view FindDrawing(std::string_view page) {
  std::string_view rest = page;
  while (!rest.empty()) {
    const std::string_view tag = TakeTag(rest);
    if (!tag.empty() && tag.front() != '?' && tag.front() != '!') {
      const bool is_drawing = tag.substr(0, tag.find_first_of(" \t\r\n/")) == kDrawing;
      return is_drawing ? page.substr(page.size() - rest.size() - tag.size() - 1) : "";
    }
  }
  return "";
}

// Whether it begins as pages do, and as next to nothing does that is encrypted.
bool IsMarkup(std::string_view bytes) {
  bytes.remove_prefix(std::min(bytes.find_first_not_of(" \t\r\n\f"), bytes.size()));
  const char c = bytes.size() > 1 && bytes.front() == '<' ? bytes[1] : '\0';
  return (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') || c == '!' || c == '?';
}

// The page as UTF-8; nothing for what is no text. The parser is given nothing else, as it ends at
// the first byte that an encoding has no character for.
std::optional<std::string> AsUtf8(const std::string& html, bool has_more) {
  if (!html.starts_with("\xEF\xBB\xBF")) {
    if (IsUtf8(html, has_more) && !HasShifts(html)) {
      return html;
    }
    if (const std::string told = ToldEncoding(html); !told.empty()) {
      return Convert(html, told);
    }
  }
  std::optional<std::string> text = DecodeText(html, has_more);
  // Some pages have a stray control character.
  return text || !IsMarkup(html) ? text : Convert(html, GuessEncoding(html));
}

}  // namespace

void AddHtml(const std::string& html, bool is_whole, Document& document) {
  const std::optional<std::string> text = AsUtf8(html, /*has_more=*/html.size() >= kMostBytes);
  if (!text) {
    return;
  }
  xmlSAXHandler sax{};
  sax.startElement = Page::Start;
  sax.endElement = Page::End;
  sax.characters = Page::Characters;
  sax.cdataBlock = Page::Characters;
  sax.ignorableWhitespace = Page::Characters;
  const std::string_view drawing = FindDrawing(*text);
  std::string_view rest = drawing.empty() ? *text : drawing;
  Page page{document, is_whole, !drawing.empty(), 0, false, {}, {}, nullptr};
  const std::unique_ptr<htmlParserCtxt, void (*)(htmlParserCtxtPtr)> parser(
      htmlCreatePushParserCtxt(&sax, &page, nullptr, 0, nullptr, XML_CHAR_ENCODING_UTF8),
      htmlFreeParserCtxt);
  if (parser == nullptr) {
    throw std::bad_alloc();
  }
  htmlCtxtUseOptions(parser.get(), HTML_PARSE_RECOVER | HTML_PARSE_NONET | HTML_PARSE_NOERROR |
                                       HTML_PARSE_NOWARNING | HTML_PARSE_IGNORE_ENC);
  while (!rest.empty() && !document.text.IsFull()) {
    const std::string_view part = rest.substr(0, kPartBytes);
    if (htmlParseChunk(parser.get(), part.data(), static_cast<int>(part.size()),
                       /*terminate=*/0) == XML_ERR_NO_MEMORY) {
      throw std::bad_alloc();
    }
    rest.remove_prefix(part.size());
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
