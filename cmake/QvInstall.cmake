# Installation: the four shared libraries, their public headers, the
# message catalog, the trace printer (qv-print-trace), a CMake package
# (find_package(qv) gives qv::qv_sr ...), a pkg-config file
# (pkg-config --cflags --libs qv_sr), and the user documentation with the
# example programs and the CMake file that builds them (share/doc/qv).
include(CMakePackageConfigHelpers)

set(QV_PUBLIC_HEADERS
  ${PROJECT_SOURCE_DIR}/cu/include/qv_types.h
  ${PROJECT_SOURCE_DIR}/cu/include/qv_cu.h
  ${PROJECT_SOURCE_DIR}/cu/include/qv_cu_expression.h
  ${PROJECT_SOURCE_DIR}/tr/include/qv_tr.h
  ${PROJECT_SOURCE_DIR}/pmsg/include/qv_pmsg.h
  ${PROJECT_SOURCE_DIR}/sr/include/qv_sr.h)

install(TARGETS qv_cu qv_tr qv_pmsg qv_sr
  EXPORT qvTargets
  LIBRARY DESTINATION ${CMAKE_INSTALL_LIBDIR}
  INCLUDES DESTINATION ${CMAKE_INSTALL_INCLUDEDIR})
install(FILES ${QV_PUBLIC_HEADERS} DESTINATION ${CMAKE_INSTALL_INCLUDEDIR})
install(FILES ${PROJECT_BINARY_DIR}/nls/qv_sr.cat DESTINATION ${CMAKE_INSTALL_DATADIR}/qv/nls)
install(PROGRAMS ${PROJECT_SOURCE_DIR}/tools/print-trace.sh DESTINATION ${CMAKE_INSTALL_BINDIR}
  RENAME qv-print-trace)

install(EXPORT qvTargets NAMESPACE qv:: DESTINATION ${CMAKE_INSTALL_LIBDIR}/cmake/qv)
configure_package_config_file(${PROJECT_SOURCE_DIR}/cmake/qvConfig.cmake.in
  ${PROJECT_BINARY_DIR}/qvConfig.cmake
  INSTALL_DESTINATION ${CMAKE_INSTALL_LIBDIR}/cmake/qv)
write_basic_package_version_file(${PROJECT_BINARY_DIR}/qvConfigVersion.cmake
  COMPATIBILITY SameMajorVersion)
install(FILES ${PROJECT_BINARY_DIR}/qvConfig.cmake ${PROJECT_BINARY_DIR}/qvConfigVersion.cmake
  DESTINATION ${CMAKE_INSTALL_LIBDIR}/cmake/qv)

# The pkg-config file names its prefix relative to its own directory
# (${pcfiledir}, e.g. "${pcfiledir}/../.."), so the prefix given at install
# time, or a later move of the whole tree, needs no edit.
file(RELATIVE_PATH qv_pkgconfig_to_prefix "/prefix/${CMAKE_INSTALL_LIBDIR}/pkgconfig" "/prefix")
string(REGEX REPLACE "/$" "" qv_pkgconfig_to_prefix "${qv_pkgconfig_to_prefix}")
set(QV_PKG_CONFIG_PREFIX "\${pcfiledir}/${qv_pkgconfig_to_prefix}")
configure_file(${PROJECT_SOURCE_DIR}/cmake/qv_sr.pc.in ${PROJECT_BINARY_DIR}/qv_sr.pc @ONLY)
install(FILES ${PROJECT_BINARY_DIR}/qv_sr.pc DESTINATION ${CMAKE_INSTALL_LIBDIR}/pkgconfig)

install(FILES ${PROJECT_SOURCE_DIR}/README.md ${PROJECT_SOURCE_DIR}/docs/guide.md
  ${PROJECT_SOURCE_DIR}/docs/tracing.md ${PROJECT_SOURCE_DIR}/docs/expressions.md
  ${PROJECT_SOURCE_DIR}/docs/value-encoding.md
  DESTINATION ${CMAKE_INSTALL_DOCDIR})
install(FILES ${PROJECT_SOURCE_DIR}/examples/CMakeLists.txt
  ${PROJECT_SOURCE_DIR}/examples/open_tree.c ${PROJECT_SOURCE_DIR}/examples/configuration.c
  DESTINATION ${CMAKE_INSTALL_DOCDIR}/examples)
install(FILES ${PROJECT_SOURCE_DIR}/examples/guide/CMakeLists.txt
  ${PROJECT_SOURCE_DIR}/examples/guide/first_program.c
  ${PROJECT_SOURCE_DIR}/examples/guide/trees_and_mounts.c
  ${PROJECT_SOURCE_DIR}/examples/guide/creating_tables.c
  ${PROJECT_SOURCE_DIR}/examples/guide/rows.c
  ${PROJECT_SOURCE_DIR}/examples/guide/transactions.c
  ${PROJECT_SOURCE_DIR}/examples/guide/persistence.c
  ${PROJECT_SOURCE_DIR}/examples/guide/processes.c
  ${PROJECT_SOURCE_DIR}/examples/guide/errors_and_tracing.c
  ${PROJECT_SOURCE_DIR}/examples/guide/selection.c
  DESTINATION ${CMAKE_INSTALL_DOCDIR}/examples/guide)
