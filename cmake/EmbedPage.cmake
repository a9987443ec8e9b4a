# Puts the page of `cellar inspect --html` together and makes a source file of it:
# cmake -D SOURCES=directory -D CHARTS=chart-library.js -D OUTPUT=Page.cpp -P EmbedPage.cmake
# Without CHARTS the page is empty: a build that has none.
cmake_minimum_required(VERSION 3.22)
set(page "")
if(CHARTS)
  file(READ ${SOURCES}/page.html page)
  file(READ ${SOURCES}/page.css style)
  file(READ ${SOURCES}/page.js script)
  file(READ ${CHARTS} charts)
  string(REGEX REPLACE "//# sourceMappingURL=[^\n]*" "" charts "${charts}")
  string(FIND "${charts}" "</script" end)
  if(NOT end EQUAL -1)
    message(FATAL_ERROR "${CHARTS} cannot stand in a page: it has an end of a script in it")
  endif()
  string(REPLACE "@STYLE@" "${style}" page "${page}")
  string(REPLACE "@SCRIPT@" "${script}" page "${page}")
  string(REPLACE "@CHARTS@" "${charts}" page "${page}")
endif()
file(WRITE ${OUTPUT}.html "${page}")
file(READ ${OUTPUT}.html bytes HEX)
string(REGEX REPLACE "([0-9a-f][0-9a-f])" "0x\\1," bytes "${bytes}")
file(WRITE ${OUTPUT} "#include \"inspect/Page.h\"

namespace velmora::mobile::xplat::cellar::tools {

namespace {

const unsigned char kPage[] = {${bytes}0};

}  // namespace

const char* const kPageTemplate = reinterpret_cast<const char*>(kPage);

}  // namespace velmora::mobile::xplat::cellar::tools
")
