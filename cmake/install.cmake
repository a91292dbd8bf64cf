# Installation: `make install` runs `cmake --install build --prefix $(PREFIX)` with DESTDIR in
# the environment, so a package build reuses these rules. Files the system reads from fixed
# places (/etc, /lib/systemd) get absolute destinations; everything else follows the prefix.

# The man pages: doc/*.scd turned into roff by scdoc when it is installed.
find_program(SCDOC_EXECUTABLE scdoc)
set(TARVOD_MAN_PAGES tarvod.8 tarvodctl.8 tarvod.plist.5 tarvod-rules.5)
if(SCDOC_EXECUTABLE)
  set(man_outputs "")
  foreach(page ${TARVOD_MAN_PAGES})
    set(out ${CMAKE_BINARY_DIR}/man/${page})
    add_custom_command(OUTPUT ${out}
      COMMAND ${CMAKE_COMMAND} -E make_directory ${CMAKE_BINARY_DIR}/man
      COMMAND ${SCDOC_EXECUTABLE} < ${CMAKE_SOURCE_DIR}/doc/${page}.scd > ${out}
      DEPENDS ${CMAKE_SOURCE_DIR}/doc/${page}.scd
      COMMENT "scdoc ${page}")
    list(APPEND man_outputs ${out})
    string(REGEX MATCH "[0-9]$" section ${page})
    install(FILES ${out} DESTINATION share/man/man${section})
  endforeach()
  add_custom_target(man ALL DEPENDS ${man_outputs})
else()
  message(STATUS "scdoc not found: the man pages are neither built nor installed")
endif()

install(TARGETS tarvod DESTINATION sbin)
install(TARGETS tarvodctl DESTINATION bin)
install(TARGETS femail DESTINATION libexec/tarvod)

# The unit names the daemon where this prefix puts it.
install(CODE "
  file(READ \"${CMAKE_SOURCE_DIR}/contrib/tarvod.service\" unit)
  string(REPLACE \"ExecStart=/usr/sbin/tarvod\" \"ExecStart=\${CMAKE_INSTALL_PREFIX}/sbin/tarvod\" unit \"\${unit}\")
  file(WRITE \"${CMAKE_BINARY_DIR}/tarvod.service\" \"\${unit}\")
")
install(FILES ${CMAKE_BINARY_DIR}/tarvod.service DESTINATION /lib/systemd/system)
install(FILES contrib/com.quenta.DistributedNotifications.conf
        DESTINATION share/dbus-1/system.d)
install(FILES contrib/tarvodctl.bash-completion DESTINATION share/bash-completion/completions
        RENAME tarvodctl)
install(FILES contrib/tarvod.logrotate DESTINATION /etc/logrotate.d RENAME tarvod)

# The configuration is the administrator's: installed only where none exists yet.
install(DIRECTORY DESTINATION /etc/tarvod.d/rules)
install(CODE "
  set(conf \"\$ENV{DESTDIR}/etc/tarvod.d/tarvod.plist\")
  if(EXISTS \"\${conf}\")
    message(STATUS \"Kept: \${conf}\")
  else()
    file(INSTALL \"${CMAKE_SOURCE_DIR}/contrib/tarvod.plist\" DESTINATION /etc/tarvod.d)
  endif()
")

if(TARVOD_TESTS)
  add_test(NAME install_layout COMMAND ${CMAKE_SOURCE_DIR}/tests/install_test.sh ${CMAKE_BINARY_DIR})
endif()
