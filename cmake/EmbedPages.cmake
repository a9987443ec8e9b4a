# Puts the pages that the cellar program writes together and makes a source file of them and of the chart library:
# cmake -D SOURCES=directory -D CHARTS=chart-library.js -D OUTPUT=Pages.cpp -P EmbedPages.cmake
cmake_minimum_required(VERSION 3.22)

file(READ ${CHARTS} charts)
string(FIND "${charts}" "</script" end)
if(NOT end EQUAL -1)
  message(FATAL_ERROR "${CHARTS} cannot stand in a page: it has an end of a script in it")
endif()
string(REGEX REPLACE "//# sourceMappingURL=[^\n]*" "" charts "${charts}")

file(WRITE ${OUTPUT} "#include \"page/Page.h\"\n\nnamespace velmora::mobile::xplat::cellar::tools {\n")

# embed(NAME TEXT): a constant of that name with the text.
function(embed name text)
  file(WRITE ${OUTPUT}.text "${text}")
  file(READ ${OUTPUT}.text bytes HEX)
  string(REGEX REPLACE "([0-9a-f][0-9a-f])" "0x\\1," bytes "${bytes}")
  file(APPEND ${OUTPUT} "
namespace {
const unsigned char ${name}Bytes[] = {${bytes}0};
}  // namespace
extern const char* const ${name};
const char* const ${name} = reinterpret_cast<const char*>(${name}Bytes);
")
endfunction()

file(READ ${SOURCES}/page.html frame)
file(READ ${SOURCES}/page.css style)
file(READ ${SOURCES}/common.js common)
function(embed_page name file)
  file(READ ${SOURCES}/${file}.html body)
  file(READ ${SOURCES}/${file}.js script)
  string(REPLACE "@STYLE@" "${style}" page "${frame}")
  string(REPLACE "@BODY@" "${body}" page "${page}")
  string(REPLACE "@SCRIPT@" "${common}${script}" page "${page}")
  embed(${name} "${page}")
endfunction()

embed_page(kInspectPage inspect)
embed_page(kTunePage tune)
embed(kChartLibrary "${charts}")

file(APPEND ${OUTPUT} "\n}  // namespace velmora::mobile::xplat::cellar::tools\n")
