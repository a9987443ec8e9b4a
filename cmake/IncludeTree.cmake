# The headers of the source tree as an installed library has them, <cellar/StoreManager.h> and <cellar/host/Host.h>, made of
# links: what is written against the one builds against the other.
set(CELLAR_INCLUDE_TREE ${PROJECT_BINARY_DIR}/include)
file(MAKE_DIRECTORY ${CELLAR_INCLUDE_TREE}/cellar)
foreach(header ${CELLAR_PUBLIC_HEADERS})
  file(CREATE_LINK ${PROJECT_SOURCE_DIR}/src/${header} ${CELLAR_INCLUDE_TREE}/cellar/${header} SYMBOLIC)
endforeach()
file(CREATE_LINK ${PROJECT_SOURCE_DIR}/src/executor ${CELLAR_INCLUDE_TREE}/cellar/executor SYMBOLIC)
file(CREATE_LINK ${PROJECT_SOURCE_DIR}/src/session ${CELLAR_INCLUDE_TREE}/cellar/session SYMBOLIC)
file(CREATE_LINK ${PROJECT_SOURCE_DIR}/host ${CELLAR_INCLUDE_TREE}/cellar/host SYMBOLIC)
