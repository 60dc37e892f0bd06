# Installation and packages: versioned shared libraries, headers under one
# include directory (include/ptzpatrol, so "patrol/patrol.h" needs one -I),
# a pkg-config file per library, a relocatable CMake package, and Debian
# packages built by CPack (runtime, -dev, tools).
include(CMakePackageConfigHelpers)

set(PTZ_INCLUDE_DIR ${CMAKE_INSTALL_INCLUDEDIR}/ptzpatrol)
set(PTZ_CMAKE_DIR ${CMAKE_INSTALL_LIBDIR}/cmake/ptzpatrol)

# The library-only build (the cross build for the target) installs the
# library alone; the host provides the services.
set(PTZ_INSTALL_TARGETS ptzpatrol)
if(TARGET ptzhost)
  list(APPEND PTZ_INSTALL_TARGETS ptzhost ptzpatrol_host)
endif()
install(TARGETS ${PTZ_INSTALL_TARGETS} EXPORT ptzpatrolTargets
        LIBRARY DESTINATION ${CMAKE_INSTALL_LIBDIR} COMPONENT runtime NAMELINK_COMPONENT dev)

# Public headers: the library's API, the host services it calls, and the
# settings of our host layer that a host using it may call.
foreach(dir host patrol executor snapshot)
  install(DIRECTORY ${dir} DESTINATION ${PTZ_INCLUDE_DIR} COMPONENT dev FILES_MATCHING PATTERN "*.h")
endforeach()
install(FILES common/export.h ${PTZ_GENERATED_INCLUDE_DIR}/common/ptzpatrol_config.h
        DESTINATION ${PTZ_INCLUDE_DIR}/common COMPONENT dev)
install(FILES hostlib/db/schema.sql DESTINATION ${CMAKE_INSTALL_DATADIR}/ptzpatrol COMPONENT tools)
if(TARGET ptzhost)
  install(FILES hostlib/db/database_config.h hostlib/db/camera_status.h
          DESTINATION ${PTZ_INCLUDE_DIR}/hostlib/db COMPONENT dev)
  install(FILES hostlib/camera/onvif_camera.h DESTINATION ${PTZ_INCLUDE_DIR}/hostlib/camera COMPONENT dev)
endif()

# CMake package: find_package(ptzpatrol CONFIG) gives ptzpatrol::ptzpatrol
# (the library alone) and ptzpatrol::host (our host layer, with the library).
install(EXPORT ptzpatrolTargets NAMESPACE ptzpatrol:: DESTINATION ${PTZ_CMAKE_DIR} COMPONENT dev)
configure_package_config_file(cmake/pkg/ptzpatrolConfig.cmake.in
                              ${CMAKE_BINARY_DIR}/pkg/ptzpatrolConfig.cmake
                              INSTALL_DESTINATION ${PTZ_CMAKE_DIR})
write_basic_package_version_file(${CMAKE_BINARY_DIR}/pkg/ptzpatrolConfigVersion.cmake
                                 COMPATIBILITY SameMinorVersion)
install(FILES ${CMAKE_BINARY_DIR}/pkg/ptzpatrolConfig.cmake ${CMAKE_BINARY_DIR}/pkg/ptzpatrolConfigVersion.cmake
        DESTINATION ${PTZ_CMAKE_DIR} COMPONENT dev)

# pkg-config files, relocatable: the prefix is found from the file's own place.
file(RELATIVE_PATH PTZ_PC_TO_PREFIX ${CMAKE_INSTALL_FULL_LIBDIR}/pkgconfig ${CMAKE_INSTALL_PREFIX})
string(REGEX REPLACE "/$" "" PTZ_PC_TO_PREFIX "${PTZ_PC_TO_PREFIX}")
# The library's time_t width, for hosts that build with pkg-config.
list(TRANSFORM PTZ_TIME64_DEFINITIONS PREPEND "-D" OUTPUT_VARIABLE PTZ_PC_DEFINES)
string(JOIN " " PTZ_PC_DEFINES ${PTZ_PC_DEFINES})
set(PTZ_PC_FILES ptzpatrol)
if(TARGET ptzhost)
  list(APPEND PTZ_PC_FILES ptzhost)
endif()
foreach(pc ${PTZ_PC_FILES})
  configure_file(cmake/pkg/${pc}.pc.in ${CMAKE_BINARY_DIR}/pkg/${pc}.pc @ONLY)
  install(FILES ${CMAKE_BINARY_DIR}/pkg/${pc}.pc DESTINATION ${CMAKE_INSTALL_LIBDIR}/pkgconfig COMPONENT dev)
endforeach()

# Debian packages: cpack -G DEB in the build directory.
set(CPACK_PACKAGE_NAME ptzpatrol)
set(CPACK_PACKAGE_VERSION ${PROJECT_VERSION})
set(CPACK_PACKAGE_CONTACT "ptzpatrol developers <ptzpatrol@localhost>")
set(CPACK_PACKAGE_DESCRIPTION_SUMMARY "PTZ camera patrols and snapshots for network video recorders")
set(CPACK_GENERATOR DEB)
set(CPACK_COMPONENTS_ALL runtime dev tools)
set(CPACK_DEB_COMPONENT_INSTALL ON)
set(CPACK_DEBIAN_FILE_NAME DEB-DEFAULT)
set(CPACK_DEBIAN_ENABLE_COMPONENT_DEPENDS ON)
set(CPACK_DEBIAN_PACKAGE_SHLIBDEPS ON)
set(CPACK_DEBIAN_PACKAGE_SHLIBDEPS_PRIVATE_DIRS ${CMAKE_BINARY_DIR})
set(CPACK_DEBIAN_PACKAGE_GENERATE_SHLIBS ON)
set(CPACK_COMPONENT_DEV_DEPENDS runtime)
set(CPACK_COMPONENT_TOOLS_DEPENDS runtime)
set(CPACK_DEBIAN_RUNTIME_PACKAGE_NAME libptzpatrol${PROJECT_VERSION_MAJOR})
set(CPACK_DEBIAN_RUNTIME_PACKAGE_SECTION libs)
set(CPACK_COMPONENT_RUNTIME_DESCRIPTION
    "PTZ camera patrols and snapshots: the shared library and its host layer
 libptzpatrol runs stored PTZ patrols and takes JPEG snapshots inside a
 network video recorder; libptzhost implements the host services it calls
 on PostgreSQL (libpq), ONVIF cameras and HTTP (libcurl).")
set(CPACK_DEBIAN_DEV_PACKAGE_NAME libptzpatrol-dev)
set(CPACK_DEBIAN_DEV_PACKAGE_SECTION libdevel)
# pkg-config --cflags ptzhost reads the .pc files of its private requirements.
set(CPACK_DEBIAN_DEV_PACKAGE_DEPENDS "libpq-dev, libcurl4-openssl-dev | libcurl-dev, libpugixml-dev, libssl-dev")
set(CPACK_COMPONENT_DEV_DESCRIPTION
    "PTZ camera patrols and snapshots: development files
 Headers, pkg-config files (ptzpatrol, ptzhost) and the CMake package
 (find_package(ptzpatrol CONFIG): ptzpatrol::ptzpatrol, ptzpatrol::host).")
set(CPACK_DEBIAN_TOOLS_PACKAGE_NAME ptzpatrol)
set(CPACK_DEBIAN_TOOLS_PACKAGE_SECTION video)
set(CPACK_COMPONENT_TOOLS_DESCRIPTION
    "PTZ camera patrols and snapshots: command-line tool, guard service, schema
 The ptzpatrol tool manages cameras, patrols and weekly guard schedules, runs
 patrols and guards and takes snapshots; the ptzpatrold service (with its
 systemd unit) guards every scheduled camera from the entry in force and the
 camera's events; schema.sql creates the tables.")
include(CPack)
