# What is installed besides the programs. The units name /usr/libexec/zembra/zbd, so the prefix of an installation that
# uses them is /usr.
install(FILES packaging/zbd.socket packaging/zbd.service DESTINATION lib/systemd/system)
install(FILES packaging/zbd.tmpfiles DESTINATION lib/tmpfiles.d RENAME zbd.conf)
# Read below the root, not below the prefix.
install(FILES packaging/types.vlist DESTINATION share/nordane/types.d RENAME Common.vlist)
install(FILES packaging/zbd.8 DESTINATION ${CMAKE_INSTALL_MANDIR}/man8)
install(FILES packaging/zbctl.1 packaging/zbignite.1 DESTINATION ${CMAKE_INSTALL_MANDIR}/man1)
install(FILES README.md DESTINATION ${CMAKE_INSTALL_DOCDIR})
install(DIRECTORY docs DESTINATION ${CMAKE_INSTALL_DOCDIR})

include(packaging/cpack.cmake)
