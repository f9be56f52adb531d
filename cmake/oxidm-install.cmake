# Installation and packaging: the library (soname and links), the platform
# stand-ins, the headers under include/oxidm/, the sample plug-ins, the
# oxidm command with its man page, a CMake package (oxidm::ox_idm) and a
# pkg-config file, both relocatable; CPack makes a Debian package.
include(CMakePackageConfigHelpers)

set(OXIDM_INSTALL_INCLUDEDIR ${CMAKE_INSTALL_INCLUDEDIR}/oxidm)
set(OXIDM_INSTALL_MPMDIR ${CMAKE_INSTALL_LIBDIR}/oxidm/mpm)
set(OXIDM_INSTALL_CMAKEDIR ${CMAKE_INSTALL_LIBDIR}/cmake/oxidm)
set(OXIDM_INSTALL_PCDIR ${CMAKE_INSTALL_LIBDIR}/pkgconfig)

# Installed objects find their neighbours wherever the tree is put: the
# library and the checker next to the stand-ins, the plug-ins two levels up.
set_target_properties(ox_idm PROPERTIES INSTALL_RPATH "$ORIGIN")
foreach(plugin oxmpm_host oxmpm_principal)
  if(TARGET ${plugin})
    set_target_properties(${plugin} PROPERTIES INSTALL_RPATH "$ORIGIN/../..")
  endif()
endforeach()
if(TARGET oxidm_check)
  set_target_properties(oxidm_check PROPERTIES INSTALL_RPATH "$ORIGIN/..")
endif()

install(TARGETS ox_idm ox_cu ox_tr ox_mss EXPORT oxidmTargets
        LIBRARY DESTINATION ${CMAKE_INSTALL_LIBDIR} COMPONENT runtime NAMELINK_COMPONENT development
        INCLUDES DESTINATION ${OXIDM_INSTALL_INCLUDEDIR})
install(FILES ${PROJECT_SOURCE_DIR}/include/oxidm.h ${PROJECT_SOURCE_DIR}/platform/cu/ox_cu.h
              ${PROJECT_SOURCE_DIR}/platform/tr/ox_tr.h ${PROJECT_SOURCE_DIR}/platform/mss/ox_mss.h
              ${PROJECT_SOURCE_DIR}/mpm/oxmpm_plugin.h
        DESTINATION ${OXIDM_INSTALL_INCLUDEDIR} COMPONENT development)

# Sample plug-ins (whichever mpm/ builds), the command and its private
# checker library, the man page.
foreach(plugin oxmpm_host oxmpm_principal)
  if(TARGET ${plugin})
    install(TARGETS ${plugin} LIBRARY DESTINATION ${OXIDM_INSTALL_MPMDIR} COMPONENT runtime)
  endif()
endforeach()
if(TARGET oxidm)
  install(TARGETS oxidm RUNTIME DESTINATION ${CMAKE_INSTALL_BINDIR} COMPONENT runtime)
  install(TARGETS oxidm_check LIBRARY DESTINATION ${CMAKE_INSTALL_LIBDIR}/oxidm COMPONENT runtime)
  install(FILES ${PROJECT_SOURCE_DIR}/tools/oxidm.1 DESTINATION ${CMAKE_INSTALL_MANDIR}/man1 COMPONENT runtime)
  install(DIRECTORY ${PROJECT_SOURCE_DIR}/examples/ DESTINATION ${CMAKE_INSTALL_DOCDIR}/examples
          COMPONENT runtime)
endif()

install(EXPORT oxidmTargets NAMESPACE oxidm:: DESTINATION ${OXIDM_INSTALL_CMAKEDIR} COMPONENT development)
configure_package_config_file(${CMAKE_CURRENT_LIST_DIR}/oxidmConfig.cmake.in
                              ${PROJECT_BINARY_DIR}/oxidmConfig.cmake
                              INSTALL_DESTINATION ${OXIDM_INSTALL_CMAKEDIR}
                              PATH_VARS OXIDM_INSTALL_INCLUDEDIR OXIDM_INSTALL_MPMDIR)
write_basic_package_version_file(${PROJECT_BINARY_DIR}/oxidmConfigVersion.cmake
                                 VERSION ${PROJECT_VERSION} COMPATIBILITY SameMajorVersion)
install(FILES ${PROJECT_BINARY_DIR}/oxidmConfig.cmake ${PROJECT_BINARY_DIR}/oxidmConfigVersion.cmake
        DESTINATION ${OXIDM_INSTALL_CMAKEDIR} COMPONENT development)

# pkg-config: the prefix is found from the .pc file's own place, so the tree
# can be installed anywhere (cmake --install --prefix DIR).
file(RELATIVE_PATH OXIDM_PC_PREFIX_FROM_PCDIR /p/${OXIDM_INSTALL_PCDIR} /p)
string(REGEX REPLACE "/$" "" OXIDM_PC_PREFIX_FROM_PCDIR "${OXIDM_PC_PREFIX_FROM_PCDIR}")
configure_file(${CMAKE_CURRENT_LIST_DIR}/oxidm.pc.in ${PROJECT_BINARY_DIR}/oxidm.pc @ONLY)
install(FILES ${PROJECT_BINARY_DIR}/oxidm.pc DESTINATION ${OXIDM_INSTALL_PCDIR} COMPONENT development)

# Debian package: everything in one package, installed under /usr.
set(CPACK_GENERATOR DEB)
set(CPACK_PACKAGE_NAME oxidm)
set(CPACK_PACKAGE_VENDOR "libox_idm maintainers")
set(CPACK_PACKAGE_CONTACT "libox_idm maintainers <maintainers@invalid>")
set(CPACK_PACKAGE_DESCRIPTION_SUMMARY "identity mapping and cluster membership library, with the oxidm command")
set(CPACK_PACKAGING_INSTALL_PREFIX /usr)
set(CPACK_DEBIAN_FILE_NAME DEB-DEFAULT)
set(CPACK_DEBIAN_PACKAGE_SECTION libs)
set(CPACK_DEBIAN_PACKAGE_DEPENDS "libc6 (>= 2.36), libstdc++6 (>= 12)")
set(CPACK_DEB_COMPONENT_INSTALL OFF)
include(CPack)
