# What `cmake --install` puts where, the CMake package and pkg-config file a
# host builds against, and the Debian packages CPack makes of them.
#
# Components: "lib" is what a machine runs (the shared library, fsquery, its
# man page and bash completion); "dev" is what a host builds with (headers,
# the static library, the development link, the CMake package, fscanner.pc).

include(CMakePackageConfigHelpers)

# The headers of the host's interface: the exported classes (cache objects,
# query, records, loader, result sets and files), the lock store seam, and
# everything they include.  Nothing else is installed: a host that needs
# another header is reaching into the library's inside.
set(FSCANNER_PUBLIC_HEADERS
  fscanner/fs/fs_fileinfo.h
  fscanner/fs/fs_loader.h
  fscanner/fs/fs_query.h
  fscanner/fs/fs_resultset.h
  fscanner/fs/fs_resultset_file.h
  fscanner/fs/fs_serializer.h
  fscanner/fscommon/cache2.h
  fscanner/fscommon/cachebase.h
  fscanner/fscommon/expvalue.h
  fscanner/fscommon/querystats.h
  fscanner/fscommon/stringhelper.h
  fscanner/fscommon/sync.h)
set(FSCANNER_PUBLIC_BASE_HEADERS
  base/CpuThreshold.h
  base/KelCfg.h
  base/QvLogWrapper.h
  base/String.h
  base/kelmem.h)
foreach(header ${FSCANNER_PUBLIC_HEADERS})
  get_filename_component(dir ${header} DIRECTORY)
  install(FILES ${CMAKE_SOURCE_DIR}/src/${header}
          DESTINATION ${CMAKE_INSTALL_INCLUDEDIR}/${dir} COMPONENT dev)
endforeach()
foreach(header ${FSCANNER_PUBLIC_BASE_HEADERS})
  get_filename_component(dir ${header} DIRECTORY)
  install(FILES ${CMAKE_SOURCE_DIR}/src/${header}
          DESTINATION ${CMAKE_INSTALL_INCLUDEDIR}/fscanner/${dir} COMPONENT dev)
endforeach()

install(TARGETS fscanner fscanner_static EXPORT fscannerTargets
  LIBRARY DESTINATION ${CMAKE_INSTALL_LIBDIR} COMPONENT lib NAMELINK_COMPONENT dev
  ARCHIVE DESTINATION ${CMAKE_INSTALL_LIBDIR} COMPONENT dev)
install(TARGETS fsquery RUNTIME DESTINATION ${CMAKE_INSTALL_BINDIR} COMPONENT lib)
install(FILES ${CMAKE_SOURCE_DIR}/tools/fsquery.1
        DESTINATION ${CMAKE_INSTALL_MANDIR}/man1 COMPONENT lib)
install(FILES ${CMAKE_SOURCE_DIR}/tools/fsquery.bash-completion
        DESTINATION ${CMAKE_INSTALL_DATADIR}/bash-completion/completions
        RENAME fsquery COMPONENT lib)

# find_package(fscanner 0.2) gives fscanner::fscanner (shared) and
# fscanner::fscanner_static with their include directories, Threads, dl and
# the compile definitions a host must share.
set(FSCANNER_CMAKE_DIR ${CMAKE_INSTALL_LIBDIR}/cmake/fscanner)
install(EXPORT fscannerTargets NAMESPACE fscanner::
        DESTINATION ${FSCANNER_CMAKE_DIR} COMPONENT dev)
configure_package_config_file(${CMAKE_SOURCE_DIR}/cmake/fscannerConfig.cmake.in
  ${CMAKE_BINARY_DIR}/fscannerConfig.cmake INSTALL_DESTINATION ${FSCANNER_CMAKE_DIR})
write_basic_package_version_file(${CMAKE_BINARY_DIR}/fscannerConfigVersion.cmake
  VERSION ${PROJECT_VERSION} COMPATIBILITY SameMajorVersion)
install(FILES ${CMAKE_BINARY_DIR}/fscannerConfig.cmake ${CMAKE_BINARY_DIR}/fscannerConfigVersion.cmake
        DESTINATION ${FSCANNER_CMAKE_DIR} COMPONENT dev)

# pkg-config: the same directories and definitions, from the same variables.
# The prefix is found relative to the file itself, so that the file holds
# wherever the tree is installed (`cmake --install --prefix`, a package).
string(REGEX REPLACE "[^/]+" ".." FSCANNER_PC_UP "${CMAKE_INSTALL_LIBDIR}/pkgconfig")
set(FSCANNER_PC_CFLAGS "")
foreach(definition ${FSCANNER_HOST_DEFINITIONS})
  string(APPEND FSCANNER_PC_CFLAGS " -D${definition}")
endforeach()
set(FSCANNER_PC_LIBS_PRIVATE "")
foreach(library Threads::Threads ${CMAKE_DL_LIBS})
  if(library STREQUAL "Threads::Threads")
    string(APPEND FSCANNER_PC_LIBS_PRIVATE " -pthread")
  else()
    string(APPEND FSCANNER_PC_LIBS_PRIVATE " -l${library}")
  endif()
endforeach()
configure_file(${CMAKE_SOURCE_DIR}/cmake/fscanner.pc.in ${CMAKE_BINARY_DIR}/fscanner.pc @ONLY)
install(FILES ${CMAKE_BINARY_DIR}/fscanner.pc
        DESTINATION ${CMAKE_INSTALL_LIBDIR}/pkgconfig COMPONENT dev)

# `make package`: one Debian package per component.
set(CPACK_GENERATOR DEB)
set(CPACK_PACKAGE_NAME fscanner)
set(CPACK_PACKAGE_VENDOR "fscanner developers")
set(CPACK_PACKAGE_CONTACT "fscanner developers <fscanner@localhost>")
set(CPACK_PACKAGE_DESCRIPTION_SUMMARY "file query library for inventory scanners, and its query tool")
set(CPACK_PACKAGE_VERSION ${PROJECT_VERSION})
set(CPACK_PACKAGING_INSTALL_PREFIX /usr)
set(CPACK_DEB_COMPONENT_INSTALL ON)
set(CPACK_COMPONENTS_ALL lib dev)
set(CPACK_DEBIAN_FILE_NAME DEB-DEFAULT)
set(CPACK_DEBIAN_LIB_PACKAGE_NAME fscanner)
set(CPACK_DEBIAN_LIB_PACKAGE_SECTION libs)
set(CPACK_DEBIAN_LIB_PACKAGE_SHLIBDEPS OFF)
set(CPACK_DEBIAN_LIB_PACKAGE_DEPENDS "libc6, libstdc++6")
set(CPACK_DEBIAN_DEV_PACKAGE_NAME fscanner-dev)
set(CPACK_DEBIAN_DEV_PACKAGE_SECTION libdevel)
set(CPACK_DEBIAN_DEV_PACKAGE_DEPENDS "fscanner (= ${PROJECT_VERSION})")
set(CPACK_COMPONENT_LIB_DESCRIPTION "fscanner library and the fsquery tool")
set(CPACK_COMPONENT_DEV_DESCRIPTION "fscanner headers, static library, CMake package and pkg-config file")
include(CPack)
