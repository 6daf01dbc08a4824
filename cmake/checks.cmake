# Checks that belong to the build: which way includes point, and that every header compiles alone.
add_test(NAME layering
  COMMAND python3 ${PROJECT_SOURCE_DIR}/packaging/checks/layering.py ${PROJECT_SOURCE_DIR})

# One source per header that includes nothing else, and that twice: Ninja then knows which headers are due again.
# A header with a source of its own compiles alone as that source's first include, where clang-format puts it.
file(GLOB headers CONFIGURE_DEPENDS RELATIVE ${PROJECT_SOURCE_DIR}
  ${PROJECT_SOURCE_DIR}/platform/*.h ${PROJECT_SOURCE_DIR}/platform/*/*.h ${PROJECT_SOURCE_DIR}/SableKit/*.h
  ${PROJECT_SOURCE_DIR}/SableKit/*/*.h
  ${PROJECT_SOURCE_DIR}/sabled/*.h ${PROJECT_SOURCE_DIR}/tests/support/*.h ${PROJECT_SOURCE_DIR}/tools/*/*.h)
set(header_sources "")
foreach(header ${headers})
  string(REGEX REPLACE "h$" "cpp" own ${header})
  if(EXISTS ${PROJECT_SOURCE_DIR}/${own})
    continue()
  endif()
  set(source ${CMAKE_BINARY_DIR}/headers/${header}.cpp)
  file(CONFIGURE OUTPUT ${source} CONTENT "#include \"${header}\"\n#include \"${header}\"\n")
  list(APPEND header_sources ${source})
endforeach()
if(header_sources)
  add_library(headers OBJECT EXCLUDE_FROM_ALL ${header_sources})
  target_include_directories(headers PRIVATE ${PROJECT_SOURCE_DIR}/tools/sable-service)
  target_link_libraries(headers PRIVATE test_support feedback_messages CURL::libcurl SQLite::SQLite3 OpenSSL::Crypto CLI11::CLI11
    PkgConfig::SYSTEMD PkgConfig::ICU PkgConfig::TOMLPLUSPLUS PkgConfig::SIMDJSON)
endif()
