# Installation of the library for programs that use it: the shared library and its public
# headers, the bundle resources, a pkg-config file and a CMake package with the exported target
# Plenzo::plenzo. plzc installs itself (Tools/plzc). Include this file after the plenzo target.
include(GNUInstallDirs)
include(CMakePackageConfigHelpers)

set(PLENZO_INSTALL_INCLUDEDIR ${CMAKE_INSTALL_INCLUDEDIR}/plenzo)
set(PLENZO_INSTALL_CMAKEDIR ${CMAKE_INSTALL_LIBDIR}/cmake/Plenzo)

target_include_directories(plenzo PUBLIC $<INSTALL_INTERFACE:${PLENZO_INSTALL_INCLUDEDIR}>)
install(TARGETS plenzo EXPORT PlenzoTargets
  LIBRARY DESTINATION ${CMAKE_INSTALL_LIBDIR})
install(FILES ${PROJECT_SOURCE_DIR}/Plenzo.h ${PROJECT_SOURCE_DIR}/PropertyValue.h
  DESTINATION ${PLENZO_INSTALL_INCLUDEDIR})
# The bundle "com.tavix.Plenzo": the library finds it relative to where it is installed.
install(DIRECTORY ${PROJECT_SOURCE_DIR}/Resources/ DESTINATION ${CMAKE_INSTALL_DATADIR}/com.tavix.Plenzo)

# pkg-config: every path is relative to the .pc file, so that an installation moved elsewhere,
# or made with 'cmake --install --prefix', still describes itself.
file(RELATIVE_PATH PLENZO_PC_TO_PREFIX ${CMAKE_INSTALL_FULL_LIBDIR}/pkgconfig ${CMAKE_INSTALL_PREFIX})
string(REGEX REPLACE "/$" "" PLENZO_PC_TO_PREFIX "${PLENZO_PC_TO_PREFIX}")
file(RELATIVE_PATH PLENZO_PC_LIBDIR ${CMAKE_INSTALL_PREFIX} ${CMAKE_INSTALL_FULL_LIBDIR})
file(RELATIVE_PATH PLENZO_PC_INCLUDEDIR ${CMAKE_INSTALL_PREFIX} ${CMAKE_INSTALL_FULL_INCLUDEDIR}/plenzo)
set(PLENZO_PC_ENGINE_REQUIRES "")
if(PLZC_OPTIONAL_ENGINES)
  set(PLENZO_PC_ENGINE_REQUIRES " libdeflate libisal")
endif()
configure_file(${PROJECT_SOURCE_DIR}/plenzo.pc.in ${PROJECT_BINARY_DIR}/plenzo.pc @ONLY)
install(FILES ${PROJECT_BINARY_DIR}/plenzo.pc DESTINATION ${CMAKE_INSTALL_LIBDIR}/pkgconfig)

# CMake: find_package(Plenzo CONFIG) gives the imported target Plenzo::plenzo.
install(EXPORT PlenzoTargets NAMESPACE Plenzo:: DESTINATION ${PLENZO_INSTALL_CMAKEDIR})
configure_package_config_file(${PROJECT_SOURCE_DIR}/cmake/PlenzoConfig.cmake.in
  ${PROJECT_BINARY_DIR}/PlenzoConfig.cmake INSTALL_DESTINATION ${PLENZO_INSTALL_CMAKEDIR})
# Before 1.0 a minor version may change the interface.
write_basic_package_version_file(${PROJECT_BINARY_DIR}/PlenzoConfigVersion.cmake
  VERSION ${PROJECT_VERSION} COMPATIBILITY SameMinorVersion)
install(FILES ${PROJECT_BINARY_DIR}/PlenzoConfig.cmake ${PROJECT_BINARY_DIR}/PlenzoConfigVersion.cmake
  DESTINATION ${PLENZO_INSTALL_CMAKEDIR})
