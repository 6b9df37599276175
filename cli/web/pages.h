// The files of the page, which are part of the program: cmake/embed.cmake makes the source of
// cli/web/page.
#ifndef CLI_WEB_PAGES_H_
#define CLI_WEB_PAGES_H_

#include <span>
#include <string_view>

namespace vexlo::cli {

struct Page {
  std::string_view path;  // "/page.js"
  std::string_view type;
  std::string_view text;
};

std::span<const Page> EmbeddedPages();

}  // namespace vexlo::cli

#endif  // CLI_WEB_PAGES_H_
