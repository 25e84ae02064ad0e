# Build conventions shared by every target of the project: warnings as
# errors, sanitizer flags, and the helpers that define a library (shared with
# hidden symbols and a version script, plus a static twin for white-box
# tests) and a test executable.

add_compile_options(-Wall -Wextra -Werror)
# Source paths inside binaries (error messages, traces) are relative to the
# project root, so that they name a module ("sr/sr_x_open_tree.cpp") and not a
# build machine's directory.
add_compile_options("-ffile-prefix-map=${PROJECT_SOURCE_DIR}/=")

if(QV_SANITIZE STREQUAL "address")
  add_compile_options(-fsanitize=address,undefined -fno-omit-frame-pointer -fno-sanitize-recover=all)
  add_link_options(-fsanitize=address,undefined)
elseif(QV_SANITIZE STREQUAL "thread")
  add_compile_options(-fsanitize=thread -fno-omit-frame-pointer)
  add_link_options(-fsanitize=thread)
elseif(NOT QV_SANITIZE STREQUAL "")
  message(FATAL_ERROR "QV_SANITIZE must be empty, 'address' or 'thread'")
endif()

find_package(Threads REQUIRED)

# Installed files find each other wherever the prefix is moved: an installed
# library looks for the others beside itself, an installed program in the
# library directory relative to its own. The build tree keeps its own
# absolute run paths.
file(RELATIVE_PATH qv_bin_to_lib "/prefix/${CMAKE_INSTALL_BINDIR}" "/prefix/${CMAKE_INSTALL_LIBDIR}")
set(CMAKE_INSTALL_RPATH "\$ORIGIN/${qv_bin_to_lib}")

# qv_add_library(<name> VERSION_SCRIPT <file> SOURCES <files...>
#                [PUBLIC_LIBS <targets...>] [PRIVATE_LIBS <targets...>])
# Defines <name> (the shared library lib<name>.so exporting only what the
# version script lists) and <name>_internal (a static library of the same
# objects with every symbol reachable, for white-box tests).
function(qv_add_library name)
  cmake_parse_arguments(ARG "" "VERSION_SCRIPT" "SOURCES;PUBLIC_LIBS;PRIVATE_LIBS" ${ARGN})
  add_library(${name}_objects OBJECT ${ARG_SOURCES})
  set_target_properties(${name}_objects PROPERTIES
    POSITION_INDEPENDENT_CODE ON
    C_VISIBILITY_PRESET hidden
    CXX_VISIBILITY_PRESET hidden
    VISIBILITY_INLINES_HIDDEN ON)
  target_include_directories(${name}_objects PUBLIC
    $<BUILD_INTERFACE:${CMAKE_CURRENT_SOURCE_DIR}/include>
    $<INSTALL_INTERFACE:${CMAKE_INSTALL_INCLUDEDIR}>)
  target_link_libraries(${name}_objects PUBLIC ${ARG_PUBLIC_LIBS} PRIVATE ${ARG_PRIVATE_LIBS})

  add_library(${name} SHARED)
  target_link_libraries(${name} PRIVATE ${name}_objects ${ARG_PRIVATE_LIBS} PUBLIC ${ARG_PUBLIC_LIBS})
  target_include_directories(${name} PUBLIC
    $<BUILD_INTERFACE:${CMAKE_CURRENT_SOURCE_DIR}/include>
    $<INSTALL_INTERFACE:${CMAKE_INSTALL_INCLUDEDIR}>)
  set_target_properties(${name} PROPERTIES
    VERSION ${PROJECT_VERSION}
    SOVERSION ${PROJECT_VERSION_MAJOR}
    INSTALL_RPATH "\$ORIGIN"
    LINK_DEPENDS ${ARG_VERSION_SCRIPT})
  target_link_options(${name} PRIVATE "LINKER:--version-script=${ARG_VERSION_SCRIPT}")
  if(QV_SANITIZE STREQUAL "")
    target_link_options(${name} PRIVATE "LINKER:--no-undefined")
  endif()
  add_library(qv::${name} ALIAS ${name})

  add_library(${name}_internal STATIC)
  target_link_libraries(${name}_internal PUBLIC ${name}_objects ${ARG_PUBLIC_LIBS} ${ARG_PRIVATE_LIBS})

  set_property(GLOBAL APPEND PROPERTY QV_EXPORTED_LIBRARIES "${name}|${ARG_VERSION_SCRIPT}")
endfunction()

# qv_add_test(<name> SOURCES <files...> LIBS <targets...> LABELS <label>)
# A GoogleTest executable whose cases CTest runs one by one, each carrying
# the label ("quick", "concurrency", ...) so that CI can pick a subset.
function(qv_add_test name)
  cmake_parse_arguments(ARG "" "LABELS" "SOURCES;LIBS" ${ARGN})
  add_executable(${name} ${ARG_SOURCES})
  target_link_libraries(${name} PRIVATE ${ARG_LIBS} GTest::gtest GTest::gtest_main Threads::Threads)
  gtest_discover_tests(${name}
    PROPERTIES LABELS ${ARG_LABELS}
    DISCOVERY_TIMEOUT 60)
endfunction()
