# What `cmake --install` puts under the prefix: the library with libOVIX.so beside it, the one
# public header, the tool and its manual page, the Python module, and the files pkg-config and
# find_package read. Test and internal libraries stay in the build tree.
include(CMakePackageConfigHelpers)

set(TQOVIX_CMAKE_DIR ${CMAKE_INSTALL_LIBDIR}/cmake/TqOVIXUtility)
set(TQOVIX_PYTHON_DIR lib/python3/dist-packages)

# OVIX comes into the package too: a host's linker must find what the library needs.
install(TARGETS TqOVIXUtility OVIX EXPORT TqOVIXUtilityTargets
  LIBRARY DESTINATION ${CMAKE_INSTALL_LIBDIR})
install(FILES ${PROJECT_SOURCE_DIR}/src/api/TqOVIXUtility.h DESTINATION ${CMAKE_INSTALL_INCLUDEDIR})
# The reasons behind failures, loaded by the Python module from beside the library; no host
# links it, so it comes without a header or a development link.
install(TARGETS TqOVIXReasons LIBRARY DESTINATION ${CMAKE_INSTALL_LIBDIR} NAMELINK_SKIP)

if(TARGET tqovix)
  # The tool finds the installed library wherever the prefix is moved.
  file(RELATIVE_PATH TQOVIX_BIN_TO_LIB ${CMAKE_INSTALL_FULL_BINDIR} ${CMAKE_INSTALL_FULL_LIBDIR})
  set_target_properties(tqovix PROPERTIES INSTALL_RPATH "$ORIGIN/${TQOVIX_BIN_TO_LIB}")
  install(TARGETS tqovix RUNTIME DESTINATION ${CMAKE_INSTALL_BINDIR})
endif()
install(FILES ${PROJECT_SOURCE_DIR}/man/tqovix.1 DESTINATION ${CMAKE_INSTALL_MANDIR}/man1)
install(FILES ${PROJECT_SOURCE_DIR}/python/tqovix_utility.py DESTINATION ${TQOVIX_PYTHON_DIR})

install(EXPORT TqOVIXUtilityTargets NAMESPACE TqOVIXUtility:: DESTINATION ${TQOVIX_CMAKE_DIR})
configure_package_config_file(${CMAKE_CURRENT_LIST_DIR}/TqOVIXUtilityConfig.cmake.in
  ${PROJECT_BINARY_DIR}/TqOVIXUtilityConfig.cmake INSTALL_DESTINATION ${TQOVIX_CMAKE_DIR})
write_basic_package_version_file(${PROJECT_BINARY_DIR}/TqOVIXUtilityConfigVersion.cmake
  COMPATIBILITY SameMajorVersion)
install(FILES ${PROJECT_BINARY_DIR}/TqOVIXUtilityConfig.cmake ${PROJECT_BINARY_DIR}/TqOVIXUtilityConfigVersion.cmake
  DESTINATION ${TQOVIX_CMAKE_DIR})

# The .pc file names its paths from its own place, so `cmake --install --prefix` (or a moved
# prefix) needs no second configure; absolute directories the user chose are kept as given.
set(TQOVIX_PC_DIR ${CMAKE_INSTALL_LIBDIR}/pkgconfig)
if(IS_ABSOLUTE ${CMAKE_INSTALL_LIBDIR})
  set(TQOVIX_PC_PREFIX ${CMAKE_INSTALL_PREFIX})
else()
  file(RELATIVE_PATH TQOVIX_PC_TO_PREFIX /prefix/${TQOVIX_PC_DIR} /prefix)
  string(REGEX REPLACE "/$" "" TQOVIX_PC_TO_PREFIX "${TQOVIX_PC_TO_PREFIX}")
  set(TQOVIX_PC_PREFIX "\${pcfiledir}/${TQOVIX_PC_TO_PREFIX}")
endif()
foreach(kind LIBDIR INCLUDEDIR)
  if(IS_ABSOLUTE ${CMAKE_INSTALL_${kind}})
    set(TQOVIX_PC_${kind} ${CMAKE_INSTALL_${kind}})
  else()
    set(TQOVIX_PC_${kind} "\${prefix}/${CMAKE_INSTALL_${kind}}")
  endif()
endforeach()
configure_file(${CMAKE_CURRENT_LIST_DIR}/TqOVIXUtility.pc.in ${PROJECT_BINARY_DIR}/TqOVIXUtility.pc @ONLY)
install(FILES ${PROJECT_BINARY_DIR}/TqOVIXUtility.pc DESTINATION ${TQOVIX_PC_DIR})
