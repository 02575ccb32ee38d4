# Installation: programs, the two shared libraries, the history library with its headers, and what a
# program that links them needs (pkg-config files, CMake package).

include(CMakePackageConfigHelpers)

set(headerDir ${CMAKE_INSTALL_INCLUDEDIR}/zq3)
set(packageDir ${CMAKE_INSTALL_LIBDIR}/cmake/sqluhist)
set(pkgconfigDir ${CMAKE_INSTALL_LIBDIR}/pkgconfig)

# Under /usr the system finds the libraries by itself; anywhere else the files find each other,
# wherever the tree is moved.
if(NOT CMAKE_INSTALL_PREFIX STREQUAL "/usr")
  file(RELATIVE_PATH libFromBin /${CMAKE_INSTALL_BINDIR} /${CMAKE_INSTALL_LIBDIR})
  set_target_properties(zq3ckrst zq3hist PROPERTIES INSTALL_RPATH "$ORIGIN/${libFromBin}")
  set_target_properties(zq3 zq3osse PROPERTIES INSTALL_RPATH "$ORIGIN")
endif()

target_include_directories(sqluhist INTERFACE $<INSTALL_INTERFACE:${headerDir}>)
target_include_directories(zq3 INTERFACE $<INSTALL_INTERFACE:${headerDir}>)
target_include_directories(zq3osse INTERFACE $<INSTALL_INTERFACE:${headerDir}>)
target_compile_features(sqluhist INTERFACE cxx_std_17)

install(TARGETS zq3ckrst zq3hist RUNTIME)
install(TARGETS sqluhist zq3 zq3osse EXPORT sqluhistTargets)
# The #include lines of the headers hold in the installed layout, too.
install(FILES include/zq3.h DESTINATION ${headerDir})
install(FILES history/sqluhist.h DESTINATION ${headerDir}/history)
install(FILES sqo/sqlca.h sqo/sqlo.h sqo/sqlonlck.h sqo/sqlpd.h sqo/sqlzkrcb.h
        DESTINATION ${headerDir}/sqo)

install(EXPORT sqluhistTargets NAMESPACE zq3:: DESTINATION ${packageDir})
file(WRITE ${PROJECT_BINARY_DIR}/sqluhistConfig.cmake
  "include(\"\${CMAKE_CURRENT_LIST_DIR}/sqluhistTargets.cmake\")\n")
write_basic_package_version_file(${PROJECT_BINARY_DIR}/sqluhistConfigVersion.cmake
  COMPATIBILITY SameMajorVersion)
install(FILES ${PROJECT_BINARY_DIR}/sqluhistConfig.cmake
              ${PROJECT_BINARY_DIR}/sqluhistConfigVersion.cmake DESTINATION ${packageDir})

file(RELATIVE_PATH prefixFromPkgconfig /${pkgconfigDir} /)
function(zq3_pkgconfig pcName pcLibs pcDescription)
  configure_file(cmake/library.pc.in ${PROJECT_BINARY_DIR}/${pcName}.pc @ONLY)
  install(FILES ${PROJECT_BINARY_DIR}/${pcName}.pc DESTINATION ${pkgconfigDir})
endfunction()
zq3_pkgconfig(libsqluhist "-lsqluhist -lzq3osse"
  "Recovery-history files of a database: reading, writing, recovery")
zq3_pkgconfig(zq3 "-lzq3" "Scans of a database's recovery history")

install(FILES man/zq3ckrst.1 man/zq3hist.1 DESTINATION ${CMAKE_INSTALL_MANDIR}/man1)
install(FILES man/libsqluhist.3 DESTINATION ${CMAKE_INSTALL_MANDIR}/man3)
install(FILES man/zq3rhist.5 man/zq3hist-json.5 DESTINATION ${CMAKE_INSTALL_MANDIR}/man5)
install(FILES docs/installed.md DESTINATION ${CMAKE_INSTALL_DOCDIR} RENAME README.md)
install(FILES docs/troubleshooting.md docs/chart.svg DESTINATION ${CMAKE_INSTALL_DOCDIR})
install(FILES CHANGES.md DESTINATION ${CMAKE_INSTALL_DOCDIR} RENAME NEWS.md)
install(DIRECTORY examples DESTINATION ${CMAKE_INSTALL_DOCDIR})
foreach(program zq3ckrst zq3hist)
  install(FILES completion/${program}.bash
          DESTINATION ${CMAKE_INSTALL_DATADIR}/bash-completion/completions RENAME ${program})
endforeach()
