# Installation: the library (soname and links), the platform stand-ins, the
# headers, the sample plug-ins, the oxidm command with its man page, the
# Kerberos module (integrations/krb5), a CMake package and a pkg-config file.
# debian/ splits the installed tree into packages.
#
# Headers all go to <prefix>/include, so every consumer writes
# #include <oxidm.h> whatever the prefix:
#   oxidm.h                             the library (libox-idm-dev)
#   oxmpm_host.h, oxmpm_principal.h     the sample plug-ins (libox-idm-dev)
#   ox_cu.h, ox_tr.h, ox_mss.h          the platform stand-ins' own headers
# The CMake package and the pkg-config file locate the prefix from their own
# place, so a tree installed or unpacked anywhere works as it is; neither
# hands an rpath to consumers.
include(CMakePackageConfigHelpers)

set(OXIDM_INSTALL_MPMDIR ${CMAKE_INSTALL_LIBDIR}/oxidm/mpm)
set(OXIDM_INSTALL_CMAKEDIR ${CMAKE_INSTALL_LIBDIR}/cmake/oxidm)
set(OXIDM_INSTALL_PCDIR ${CMAKE_INSTALL_LIBDIR}/pkgconfig)

# An installed object finds its neighbours wherever the tree is put: the
# library next to the stand-ins, the plug-ins two levels up.  Builds for a
# system directory (the Debian packages) turn this off with
# CMAKE_SKIP_INSTALL_RPATH.
set_target_properties(ox_idm PROPERTIES INSTALL_RPATH "$ORIGIN")
foreach(plugin oxmpm_host oxmpm_principal)
  set_target_properties(${plugin} PROPERTIES INSTALL_RPATH "$ORIGIN/../..")
endforeach()

install(TARGETS ox_idm ox_cu ox_tr ox_mss
        LIBRARY DESTINATION ${CMAKE_INSTALL_LIBDIR} COMPONENT runtime NAMELINK_COMPONENT development)
install(FILES ${PROJECT_SOURCE_DIR}/include/oxidm.h ${PROJECT_SOURCE_DIR}/mpm/oxmpm_host.h
              ${PROJECT_SOURCE_DIR}/mpm/oxmpm_principal.h ${PROJECT_SOURCE_DIR}/platform/cu/ox_cu.h
              ${PROJECT_SOURCE_DIR}/platform/tr/ox_tr.h ${PROJECT_SOURCE_DIR}/platform/mss/ox_mss.h
        DESTINATION ${CMAKE_INSTALL_INCLUDEDIR} COMPONENT development)
install(TARGETS oxmpm_host oxmpm_principal LIBRARY DESTINATION ${OXIDM_INSTALL_MPMDIR} COMPONENT runtime)

# The command, its private checker library, the man page and the examples.
if(TARGET oxidm)
  if(TARGET oxidm_check)
    set_target_properties(oxidm_check PROPERTIES INSTALL_RPATH "$ORIGIN/..")
    install(TARGETS oxidm_check LIBRARY DESTINATION ${CMAKE_INSTALL_LIBDIR}/oxidm COMPONENT runtime)
  endif()
  install(TARGETS oxidm RUNTIME DESTINATION ${CMAKE_INSTALL_BINDIR} COMPONENT runtime)
  install(FILES ${PROJECT_SOURCE_DIR}/tools/oxidm.1 DESTINATION ${CMAKE_INSTALL_MANDIR}/man1 COMPONENT runtime)
  install(DIRECTORY ${PROJECT_SOURCE_DIR}/examples/ DESTINATION ${CMAKE_INSTALL_DOCDIR}/examples
          COMPONENT runtime)
endif()

# CMake package: find_package(oxidm) gives oxidm::ox_idm and oxidm_MPM_DIR.
configure_package_config_file(${CMAKE_CURRENT_LIST_DIR}/oxidmConfig.cmake.in
                              ${PROJECT_BINARY_DIR}/oxidmConfig.cmake
                              INSTALL_DESTINATION ${OXIDM_INSTALL_CMAKEDIR}
                              PATH_VARS CMAKE_INSTALL_INCLUDEDIR CMAKE_INSTALL_LIBDIR OXIDM_INSTALL_MPMDIR)
write_basic_package_version_file(${PROJECT_BINARY_DIR}/oxidmConfigVersion.cmake
                                 VERSION ${PROJECT_VERSION} COMPATIBILITY SameMajorVersion)
install(FILES ${PROJECT_BINARY_DIR}/oxidmConfig.cmake ${PROJECT_BINARY_DIR}/oxidmConfigVersion.cmake
        DESTINATION ${OXIDM_INSTALL_CMAKEDIR} COMPONENT development)

# pkg-config: the prefix is found from the .pc file's own place.
file(RELATIVE_PATH OXIDM_PC_PREFIX_FROM_PCDIR /p/${OXIDM_INSTALL_PCDIR} /p)
string(REGEX REPLACE "/$" "" OXIDM_PC_PREFIX_FROM_PCDIR "${OXIDM_PC_PREFIX_FROM_PCDIR}")
configure_file(${CMAKE_CURRENT_LIST_DIR}/oxidm.pc.in ${PROJECT_BINARY_DIR}/oxidm.pc @ONLY)
install(FILES ${PROJECT_BINARY_DIR}/oxidm.pc DESTINATION ${OXIDM_INSTALL_PCDIR} COMPONENT development)
