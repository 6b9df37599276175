// The readers of formats, one for each library that reads them.
//
// Each adds to the document what it finds, and throws Fault when it finds less than the file must
// hold; what it has added by then stands. What its library throws besides counts as damage, and
// std::bad_alloc goes through. `type` is the media type that the file's beginning tells.
#ifndef DAEMONS_KAVOCONTENTEXTRACTD_FORMATS_H_
#define DAEMONS_KAVOCONTENTEXTRACTD_FORMATS_H_

#include <string>
#include <string_view>

#include "daemons/kavocontentextractd/document.h"
#include "daemons/kavocontentextractd/source.h"

namespace vexlo::extractd {

// Plain text. False, and nothing is added, for what is none.
bool ReadPlainText(const Source& source, Document& document);

void ReadAudio(const Source& source, const std::string& type, Document& document);
void ReadHtml(const Source& source, const std::string& type, Document& document);
void ReadMedia(const Source& source, const std::string& type, Document& document);
// Sets also the type, of archives that turn out to be documents.
void ReadOffice(const Source& source, const std::string& type, Document& document);
void ReadPdf(const Source& source, const std::string& type, Document& document);
void ReadPhoto(const Source& source, const std::string& type, Document& document);
void ReadRtf(const Source& source, const std::string& type, Document& document);

// Adds the text of a page; its title and author, too, when it is the whole document.
void AddHtml(const std::string& html, bool is_whole, Document& document);

}  // namespace vexlo::extractd

#endif  // DAEMONS_KAVOCONTENTEXTRACTD_FORMATS_H_
