# `cmake --install`: the library, its names as a Lua module, the tool with its manual page and a user
# unit for systemd, the headers, a CMake package and a pkg-config file.

include(CMakePackageConfigHelpers)

set(KORVEL_HEADER_DIR ${CMAKE_INSTALL_INCLUDEDIR}/korvelscript)
set(KORVEL_PACKAGE_DIR ${CMAKE_INSTALL_LIBDIR}/cmake/korvelscript)

install(TARGETS korvelscript EXPORT korvelscriptTargets
    LIBRARY DESTINATION ${CMAKE_INSTALL_LIBDIR}
    INCLUDES DESTINATION ${KORVEL_HEADER_DIR}
)
install(FILES ${CMAKE_LIBRARY_OUTPUT_DIRECTORY}/krscript.so DESTINATION ${CMAKE_INSTALL_LIBDIR})
install(FILES ${PROJECT_BINARY_DIR}/src/lua/krscript.so
    DESTINATION ${CMAKE_INSTALL_LIBDIR}/lua/5.1
)
install(TARGETS oxscript RUNTIME DESTINATION ${CMAKE_INSTALL_BINDIR})
configure_file(src/tools/oxscript/oxscript.1.in ${CMAKE_CURRENT_BINARY_DIR}/oxscript.1 @ONLY)
install(FILES ${CMAKE_CURRENT_BINARY_DIR}/oxscript.1 DESTINATION ${CMAKE_INSTALL_MANDIR}/man1)
# The unit names the tool by its full path, which `--prefix` may change.
install(CODE "
    set(CMAKE_INSTALL_FULL_BINDIR \"${CMAKE_INSTALL_BINDIR}\")
    cmake_path(ABSOLUTE_PATH CMAKE_INSTALL_FULL_BINDIR BASE_DIRECTORY \"\${CMAKE_INSTALL_PREFIX}\")
    configure_file(\"${PROJECT_SOURCE_DIR}/src/tools/oxscript/oxscript-server.service.in\"
        \"${CMAKE_CURRENT_BINARY_DIR}/oxscript-server.service\" @ONLY)
")
install(FILES ${CMAKE_CURRENT_BINARY_DIR}/oxscript-server.service DESTINATION lib/systemd/user)
foreach(header IN LISTS KORVEL_PUBLIC_HEADERS)
    cmake_path(GET header PARENT_PATH folder)
    install(FILES src/${header} DESTINATION ${KORVEL_HEADER_DIR}/${folder})
endforeach()

install(EXPORT korvelscriptTargets DESTINATION ${KORVEL_PACKAGE_DIR})
configure_package_config_file(cmake/korvelscriptConfig.cmake.in
    ${CMAKE_CURRENT_BINARY_DIR}/korvelscriptConfig.cmake
    INSTALL_DESTINATION ${KORVEL_PACKAGE_DIR}
)
write_basic_package_version_file(${CMAKE_CURRENT_BINARY_DIR}/korvelscriptConfigVersion.cmake
    COMPATIBILITY SameMajorVersion
)
install(FILES
    ${CMAKE_CURRENT_BINARY_DIR}/korvelscriptConfig.cmake
    ${CMAKE_CURRENT_BINARY_DIR}/korvelscriptConfigVersion.cmake
    DESTINATION ${KORVEL_PACKAGE_DIR}
)
# Relative to the file itself, so that `--prefix` and a moved tree hold for pkg-config, too.
file(RELATIVE_PATH KORVEL_PC_TO_PREFIX /prefix/${CMAKE_INSTALL_LIBDIR}/pkgconfig /prefix)
configure_file(cmake/korvelscript.pc.in ${CMAKE_CURRENT_BINARY_DIR}/korvelscript.pc @ONLY)
install(FILES ${CMAKE_CURRENT_BINARY_DIR}/korvelscript.pc
    DESTINATION ${CMAKE_INSTALL_LIBDIR}/pkgconfig
)
install(FILES LICENSE README.md DESTINATION ${CMAKE_INSTALL_DOCDIR})
