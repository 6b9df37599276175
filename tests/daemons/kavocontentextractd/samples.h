// Small files of many formats: made here where that can be read, else from tests/data.
#ifndef DAEMONS_KAVOCONTENTEXTRACTD_SAMPLES_H_
#define DAEMONS_KAVOCONTENTEXTRACTD_SAMPLES_H_

#include <clocale>
#include <string>
#include <vector>

#include "fuzz/zip.h"
#include "support/temp_folder.h"

using fuzz::Zip;

// An archive that says of its names that they are UTF-8, which is written in such a locale alone.
inline std::string Utf8Zip(const fuzz::Parts& parts) {
  const std::string before = setlocale(LC_CTYPE, nullptr);  // NOLINT(concurrency-mt-unsafe)
  setlocale(LC_CTYPE, "C.UTF-8");                           // NOLINT(concurrency-mt-unsafe)
  std::string bytes = Zip(parts);
  setlocale(LC_CTYPE, before.c_str());  // NOLINT(concurrency-mt-unsafe)
  return bytes;
}

inline std::string Docx(const std::string& body) {
  return Zip(
      {{"[Content_Types].xml", "<Types/>"},
       {"docProps/core.xml",
        "<cp:p xmlns:cp='c' xmlns:dc='d'><dc:title>Plan</dc:title><dc:creator>Ana</dc:creator>"
        "<dc:created>2024-05-31T12:00:00Z</dc:created></cp:p>"},
       {"word/document.xml", "<w:document xmlns:w='w'>" + body + "</w:document>"}});
}

inline std::string Odt(const std::string& body, const std::string& manifest = "<m/>") {
  return Zip({{"mimetype", "application/vnd.oasis.opendocument.text"},
              {"META-INF/manifest.xml", manifest},
              {"content.xml", "<o:d xmlns:o='o' xmlns:t='t'><o:styles>hidden</o:styles><o:body>" +
                                  body + "</o:body></o:d>"},
              {"meta.xml",
               "<o:m xmlns:o='o' xmlns:dc='d'><dc:title>Plan</dc:title>"
               "<o:document-statistic o:page-count='3' o:word-count='99'/></o:m>"}});
}

inline std::string Data(const std::string& name) { return ReadText(TEST_DATA "/" + name); }
inline std::string Pdf() { return Data("../fuzz/seeds/pdf/plan.pdf"); }

// A recording whose length was not known when its beginning was written.
inline std::string Flac() {
  constexpr size_t kSamplesAt = 22;  // 32 bits of 36; the others are 0.
  return Data("sound.flac").replace(kSamplesAt, 4, 4, '\0');
}
// 8 samples of a recording that says to have so many bytes.
inline std::string Wav(const std::string& size) {
  return "RIFF" + size + "WAVEfmt " +
         std::string("\x10\0\0\0\1\0\1\0\x40\x1F\0\0\x80\x3E\0\0\2\0\x10\0", 20) + "data" + size +
         std::string(16, '\1');
}

struct Sample {
  std::string name;  // Its extension tells little: types are found in the content.
  std::string bytes;
  std::string fields;  // JSON: some of the fields that it has; null for one that it has not.
};

inline std::vector<Sample> Samples() {
  const std::string tags =
      R"("KAVOMDTitle":"Harbour","KAVOMDAuthors":["Ana"],"KAVOMDAlbum":"Sea",)"
      R"("KAVOMDMusicalGenre":"Folk","KAVOMDAudioTrackNumber":3,"KAVOMDRecordingYear":2019,)"
      R"("KAVOMDAudioSampleRate":8000,"KAVOMDMediaTypes":["Sound"],"KAVOMDContentError":null)";
  const std::string film =
      R"({"KAVOMDTitle":"Regatta","KAVOMDPixelWidth":64,"KAVOMDPixelHeight":48,)"
      R"("KAVOMDMediaTypes":["Video","Sound"],"KAVOMDContentError":null,)";
  return {
      {"docx",
       Docx("<w:p><w:r><w:t>The har</w:t></w:r><w:t>bour</w:t></w:p><w:p><w:t>a</w:t><w:tab/>"
            "<w:t>b</w:t><w:br/><w:t>c &amp; "
            "d</w:t><w:noBreakHyphen/><w:t>e</w:t></w:p><w:instrText>PAGE</w:instrText>"),
       R"({"KAVOMDTextContent":"The harbour\na\tb\nc & d-e\n","KAVOMDTitle":"Plan","KAVOMDAuthors":["Ana"],)"
       R"("KAVOMDContentCreationDate":1717156800,"KAVOMDContentError":null,"KAVOMDContentType":)"
       R"("application/vnd.openxmlformats-officedocument.wordprocessingml.document"})"},
      {"text box in docx",
       Docx(
           "<w:p><w:t>before</w:t><w:pict><w:p><w:t>in</w:t></w:p></w:pict><w:t>after</w:t></w:p>"),
       R"({"KAVOMDTextContent":"before\nin\nafter\n"})"},
      {"xlsx",
       Zip({{"[Content_Types].xml", "<Types/>"},
            {"xl/workbook.xml", "<workbook/>"},
            {"xl/worksheets/sheet1.xml",
             "<s><row><c t='s'><v>0</v></c><c><v>4711</v></c><c t='str'><v>sum</v></c></row>"
             "<oddHeader>&amp;C&amp;\"Arial\"&amp;14&amp;K01a2b3R&amp;&amp;D "
             "&amp;P</oddHeader></s>"},
            {"xl/sharedStrings.xml", "<sst><si><t>harbour</t></si><si><t>sea</t></si></sst>"},
            {"xl/comments1.xml", "<s><comment><text><r><t>why</t></r></text></comment></s>"}}),
       R"({"KAVOMDTextContent":"sum \n R&D  \nharbour\nsea\nwhy\n4711 \n","KAVOMDContentError":null})"},
      {"parts by other names",
       Zip({{"[Content_Types].xml", "<Types/>"},
            {"word/document2.xml", "<w><p><t>two</t></p></w>"},
            {"Word/Header.xml", "<w><p><t>head</t></p></w>"}}),
       R"({"KAVOMDTextContent":"two\nhead\n","KAVOMDContentError":null,"KAVOMDContentType":)"
       R"("application/vnd.openxmlformats-officedocument.wordprocessingml.document"})"},
      {"xlsb", Zip({{"[Content_Types].xml", "<Types/>"}, {"xl/workbook.bin", "\1"}}),
       R"({"KAVOMDContentType":"application/vnd.ms-excel.sheet.binary.macroEnabled.12",)"
       R"("KAVOMDContentError":null})"},
      {"pptx",
       Zip({{"[Content_Types].xml", "<Types/>"},
            {"ppt/presentation.xml", "<p/>"},
            {"ppt/slides/slide10.xml", "<a:s xmlns:a='a'><a:p><a:t>ten</a:t></a:p></a:s>"},
            {"ppt/slides/_rels/slide10.xml.rels", "<r><t>no</t></r>"},
            {"ppt/notesSlides/notesSlide1.xml",
             "<a:s xmlns:a='a'><a:p><a:t>note</a:t></a:p></a:s>"},
            {"ppt/comments/comment1.xml", "<p:cm xmlns:p='p'><p:text>why</p:text></p:cm>"}}),
       R"({"KAVOMDTextContent":"ten\nnote\nwhy\n","KAVOMDContentError":null})"},
      {"odt", Odt("<t:h>One<t:s/>two</t:h><t:p>three<t:line-break/>four</t:p>"),
       R"({"KAVOMDTextContent":"One two\nthree\nfour\n","KAVOMDTitle":"Plan","KAVOMDPageCount":3,)"
       R"("KAVOMDWordCount":99,"KAVOMDContentError":null})"},
      {"notes in odt",
       Odt("<t:p>harbour<t:note><t:note-citation>1</t:note-citation><t:note-body><t:p>note</t:p>"
           "</t:note-body></t:note> sea<o:annotation><creator>Ana</creator><date>2024</date>"
           "<t:p>why</t:p></o:annotation>.</t:p><t:p>A<title>Map</title><desc>of</desc>B</t:p>"),
       R"({"KAVOMDTextContent":"harbour 1 \nnote\n sea Ana 2024 \nwhy\n.\nA Map of B\n"})"},
      {"locked odt", Odt("", "<m><encryption-data/></m>"),
       R"({"KAVOMDContentError":"encrypted: the document wants a password"})"},
      {"epub",
       Utf8Zip({{"mimetype", "application/epub+zip"},
                {"O/c.opf",
                 "<p xmlns:dc='d'><dc:title>Novel</dc:title><dc:creator>Ana</dc:creator>"
                 "<dc:title>Subtitle</dc:title></p>"},
                {"O/1.xhtml",
                 "<html><head><style>x</style></head><body><p>a&nbsp;b</p><p>c</p></body></html>"},
                {"O/\xC3\x9C"
                 "bung.xhtml",
                 "<html><body><p>d</p></body></html>"}}),
       R"({"KAVOMDTextContent":"a\u00a0b\nc\nd\n","KAVOMDTitle":"Novel","KAVOMDAuthors":["Ana"],)"
       R"("KAVOMDContentError":null})"},
      {"locked epub",
       Zip({{"mimetype", "application/epub+zip"},
            {"O/1.xhtml", "<p>noise"},
            {"META-INF/encryption.xml", "<e><CipherReference URI='O/1.xhtml'/></e>"},
            {"O/c.opf", "<p xmlns:dc='d'><dc:title>Novel</dc:title></p>"}}),
       R"({"KAVOMDTextContent":null,"KAVOMDTitle":"Novel",)"
       R"("KAVOMDContentError":"encrypted: the pages of the book are encrypted"})"},
      {"zip", Zip({{"a.txt", "text"}, {"content.xml", "<broken"}}),
       R"({"KAVOMDContentType":"application/zip","KAVOMDTextContent":null,"KAVOMDContentError":null})"},
      {"entities.docx",
       Zip({{"[Content_Types].xml", "<Types/>"},
            {"word/document.xml", "<!DOCTYPE w [<!ENTITY a 'aaa'>]><w><t>&a;</t></w>"}}),
       R"({"KAVOMDContentError":"damaged: the XML declares entities","KAVOMDTextContent":null})"},
      {"pdf", Pdf(),
       R"({"KAVOMDTextContent":"The harbour plan\n","KAVOMDTitle":"Plan","KAVOMDAuthors":"Ana",)"
       R"("KAVOMDNumberOfPages":1,"KAVOMDPageWidth":300.0,"KAVOMDContentCreationDate":1717156800,)"
       R"("KAVOMDContentError":null})"},
      {"pdf with an encoding of poppler-data",
       "%PDF-1.5\n1 0 obj<</Type/Catalog/Pages 2 0 R>>endobj\n"
       "2 0 obj<</Type/Pages/Count 1/Kids[3 0 R]>>endobj\n"
       "3 0 obj<</Type/Page/Parent 2 0 R/MediaBox[0 0 300 400]/Contents 6 0 R/Resources<</Font<<"
       "/F 4 0 R>>>>>>endobj\n4 0 obj<</Type/Font/Subtype/Type0/BaseFont/S/Encoding/GBK-EUC-H"
       "/DescendantFonts[5 0 R]>>endobj\n5 0 obj<</Type/Font/Subtype/CIDFontType0/BaseFont/S"
       "/CIDSystemInfo<</Registry(Adobe)/Ordering(GB1)/Supplement 2>>/DW 1000>>endobj\n"
       "6 0 obj<</Length 38>>stream\nBT /F 12 Tf 20 300 Td <b8dbbfda> Tj ET\nendstream endobj\n"
       "trailer<</Root 1 0 R>>",
       R"({"KAVOMDTextContent":"\u6e2f\u53e3\n","KAVOMDContentError":null})"},
      {"locked pdf", Data("locked.pdf"),
       R"({"KAVOMDContentError":"encrypted: the PDF wants a password","KAVOMDTextContent":null})"},
      {"html",
       "<html><head><title>A\n page</title><meta NAME='Author' content='Ana'><style>p{}</style>"
       "<script>var x = '<p>';</script></head><body><p>The <b>har</b>bour<p>x<table><tr><td>a<td>b",
       R"({"KAVOMDTextContent":"A page\nThe harbour\nx\na b \n","KAVOMDTitle":"A page",)"
       R"("KAVOMDAuthors":["Ana"],"KAVOMDContentError":null})"},
      {"Latin-2 html", "<html><head><meta charset=iso-8859-2></head><body>\xB1\xEA</body></html>",
       R"({"KAVOMDTextContent":"\u0105\u0119\n"})"},
      {"Shift_JIS html with letters of one maker, and bytes that are none",
       "<html><!-- <meta charset=koi8-r> --><META content='text/html; CHARSET = \"Shift_JIS\"'>"
       "<body>\x8D\x60\x87\x40\xFB\xFC \xFC\xFC \x8D\x60</body></html>",
       R"({"KAVOMDTextContent":"\u6e2f\u2460\u9ad9 \ufffd \u6e2f\n"})"},
      {"Latin-1 html as it is written", "<html><meta charset=iso-8859-1><p>\x93\xE4\x94 \x80</p>",
       R"({"KAVOMDTextContent":"\u201c\u00e4\u201d \u20ac\n"})"},
      {"ISO-2022-JP html", "<html><meta charset=iso-2022-jp><p>\x1B$B4A;z\x1B(B</p></html>",
       R"({"KAVOMDTextContent":"\u6f22\u5b57\n"})"},
      {"UTF-8 html with a byte that is none",
       "<html><meta charset=utf-8><p>\xE6\xB8\xAF\xE6\xB8\xAF \xE9 \xE6\xB8\xAF</p></html>",
       R"({"KAVOMDTextContent":"\u6e2f\u6e2f \ufffd \u6e2f\n"})"},
      {"Latin-1 html that says to be UTF-16", "<html><meta charset=utf-16><p>gr\xFCn",
       R"({"KAVOMDTextContent":"gr\u00fcn\n"})"},
      {"html with a byte-order mark", "\xEF\xBB\xBF<html><title>a</title>b",
       R"({"KAVOMDTextContent":"a\nb\n","KAVOMDTitle":"a"})"},
      {"html with blocks of all kinds",
       "<html><details><summary>a</summary>b</details><center>c</center><textarea>d</textarea>"
       "<button>e</button><button>f</button><svg><title>no</title><text>no</text></svg>g",
       R"({"KAVOMDTextContent":"a\nb\nc\nd\ne\nf\ng\n","KAVOMDTitle":null})"},
      {"svg",
       "<?xml version='1.0'?><!DOCTYPE svg [<!ENTITY a 'b'>]><!-- <p> --><svg><title>Map</title>"
       "<style>no</style><metadata>no</metadata><desc>of</desc><g><title>Pier</title><text>har"
       "<tspan x='9' y='0'>bour</tspan><tspan y='9'>x</tspan></text><text y='2'>y<tspan y='2'>a"
       "</tspan><tspan dy='1em'>b</tspan></text></g><svg><text>z</text></svg></svg>",
       R"({"KAVOMDTextContent":"Map\nof\nPier\nharbour\nx\nya\nb\nz\n","KAVOMDTitle":"Map"})"},
      {"epub of many encodings, and with an encrypted page",
       Zip({{"mimetype", "application/epub+zip"},
            {"O/1.xhtml", "<?xml version='1.0' encoding='euc-kr'?><html>\x8C\x63\xB9\xE6</html>"},
            {"O/2.xhtml", "\x8F\x03<b>\xE6\x1F\xD2p\xFF<p>\x07\x9A"},
            {"O/3.xhtml", "<p>gr\xFCn \x01</p>"}}),
       R"({"KAVOMDTextContent":"\ub620\ubc29\ngr\u00fcn \n"})"},
      {"rtf",
       R"({\rtf1\ansi\ansicpg1251{\fonttbl{\f0 Arial;}}{\info{\title Plan}{\author Ana}})"
       R"({\*\generator no;}The {\b har}bour\'cf \u8364?5 \u55357?\u56832?\par{\pict 01ab}\{x\}\tab y})",
       R"({"KAVOMDTextContent":"The harbour\u041f \u20ac5 \ud83d\ude00\n{x}\ty","KAVOMDTitle":"Plan",)"
       R"("KAVOMDAuthors":"Ana","KAVOMDContentError":null})"},
      {"rtf with fonts of many encodings, and a text box",
       R"({\rtf1\pca\deff3{\info{\title\'94}}{\fonttbl{\f0\fcharset0 A;}{\f1\fcharset204 B;})"
       R"({\f2\fcharset128 C;}{\f3\fcharset238 D;}}\'9c\f0\'94{\f1\'cf\f2\'8d\'60}\'94\plain\'9c)"
       R"({\shp{\*\shpinst no{\shptxt box\par}}{\shprslt no}}\f1\'cf})",
       R"({"KAVOMDTextContent":"\u015b\u00f6\u041f\u6e2f\u00f6\u015b\nbox\n\u041f","KAVOMDTitle":"\u00f6"})"},
      {"cut rtf", R"({\rtf1 some {\b text)",
       R"({"KAVOMDTextContent":"some text","KAVOMDContentError":"damaged: the RTF ends within a group"})"},
      {"photo", Data("photo.jpg"),
       R"({"KAVOMDPixelWidth":64,"KAVOMDPixelHeight":48,"KAVOMDAcquisitionMake":"Canon",)"
       R"("KAVOMDAcquisitionModel":"EOS","KAVOMDContentCreationDate":1717156800,"KAVOMDISOSpeed":200,)"
       R"("KAVOMDDescription":"Harbour bridge","KAVOMDKeywords":["bridge","sea"],)"
       R"("KAVOMDExposureTimeString":"1/125 s","KAVOMDStarRating":"4","KAVOMDTitle":"Br\u00fccke",)"
       R"("KAVOMDLatitude":-33.86,"KAVOMDLongitude":151.2,"KAVOMDContentError":null})"},
      {"photo with a zone, no place and no UTF-8", Data("old_camera.jpg"),
       R"({"KAVOMDDescription":"Br\u00fccke","KAVOMDKeywords":["Stra\u00dfe"],"KAVOMDComment":"hello",)"
       R"("KAVOMDCity":"K\u00f6ln","KAVOMDContentCreationDate":1717156800,"KAVOMDLatitude":null})"},
      {"mp3", Data("sound.mp3"), "{\"KAVOMDComment\":\"quiet\"," + tags + "}"},
      {"ogg", Data("sound.ogg"), "{\"KAVOMDDurationSecond\":0.2," + tags + "}"},
      {"m4a", Data("sound.m4a"), "{\"KAVOMDComment\":\"quiet\"," + tags + "}"},
      {"flac from a pipe", Flac(),
       R"({"KAVOMDAudioSampleRate":8000,"KAVOMDDurationSecond":null,"KAVOMDContentError":null})"},
      {"wav from a pipe", Wav("\xFF\xFF\xFF\xFF"),
       R"({"KAVOMDAudioSampleRate":8000,"KAVOMDContentError":null})"},
      {"cut wav", Wav({"\0\1\0\0", 4}),
       R"({"KAVOMDContentError":"damaged: the sound cannot be found in the file"})"},
      {"soundfont",
       {"RIFF\4\0\0\0sfbk", 12},
       R"({"KAVOMDContentType":"audio/x-sfbk","KAVOMDContentError":null})"},
      {"mp4", Data("film.mp4"),
       film + R"("KAVOMDCodecs":["MPEG-4 Visual","AAC"],"KAVOMDDurationSecond":1.0,)"
              R"("KAVOMDContentCreationDate":1717156800})"},
      {"mkv", Data("film.mkv"), film + R"("KAVOMDCodecs":["MPEG-4 Visual","Vorbis"]})"},
  };
}

#endif  // DAEMONS_KAVOCONTENTEXTRACTD_SAMPLES_H_
