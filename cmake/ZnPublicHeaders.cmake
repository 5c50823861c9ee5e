# The headers that users compile against: all of gscl/ but those that are marked as the library's own.
file(GLOB ZN_PUBLIC_GSCL_HEADERS CONFIGURE_DEPENDS ${PROJECT_SOURCE_DIR}/gscl/*.h)
list(FILTER ZN_PUBLIC_GSCL_HEADERS EXCLUDE REGEX "(_internal|/trace)\\.h$")
