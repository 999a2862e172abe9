# Run by `cmake --install`: installs the systemd unit for the prefix this
# install uses, and lays the default installation out under VELMOR_ROOT with
# the standard ports, server.user set and no demo user. Installed for real
# (no DESTDIR) by root, it also makes the system user when it is missing and
# hands the installation to it; a package built into DESTDIR leaves both to
# its own install scripts, and nothing written names the DESTDIR folder.
set(root "$ENV{DESTDIR}${VELMOR_ROOT}")

# The unit names the binary where this install puts it (cmake --install
# --prefix may choose another prefix than the build did).
configure_file("${VELMOR_UNIT_TEMPLATE}" "${VELMOR_BUILD_DIR}/velmor.service.installed" @ONLY)
file(INSTALL "${VELMOR_BUILD_DIR}/velmor.service.installed" DESTINATION "${CMAKE_INSTALL_PREFIX}/lib/systemd/system"
     RENAME velmor.service)

set(user_args --user ${VELMOR_USER})
if("$ENV{DESTDIR}" STREQUAL "")
  execute_process(COMMAND id -u OUTPUT_VARIABLE uid OUTPUT_STRIP_TRAILING_WHITESPACE)
  if(uid STREQUAL "0")
    set(owner TRUE)
    execute_process(COMMAND id -u ${VELMOR_USER} RESULT_VARIABLE missing OUTPUT_QUIET ERROR_QUIET)
    if(missing)
      message(STATUS "Making the system user ${VELMOR_USER}")
      execute_process(COMMAND useradd --system --user-group --home-dir ${VELMOR_ROOT} --no-create-home
                              --shell /usr/sbin/nologin ${VELMOR_USER}
                      COMMAND_ERROR_IS_FATAL ANY)
    endif()
  else()
    set(user_args)  # nobody to switch to: the suite runs as whoever starts it
  endif()
endif()
if("$ENV{DESTDIR}" STREQUAL "" AND NOT owner)
  # An install by a user into a prefix of their own (to have the programs on
  # PATH): the installation folder is written when that user may, else later
  # by hand.
  execute_process(COMMAND ${VELMOR_BIN} --root ${root} --init --standard-ports --no-demo ${user_args}
                  RESULT_VARIABLE init_failed)
  if(init_failed)
    message(STATUS "No installation written in ${root}: make one with velmor --root DIR --init")
    return()
  endif()
else()
  execute_process(COMMAND ${VELMOR_BIN} --root ${root} --init --standard-ports --no-demo ${user_args}
                  COMMAND_ERROR_IS_FATAL ANY)
endif()
if(owner)
  # -h: a link inside the tree is changed itself, never what it points to.
  execute_process(COMMAND chown -hR ${VELMOR_USER}:${VELMOR_USER} ${root} COMMAND_ERROR_IS_FATAL ANY)
endif()
message(STATUS "Add users with: velmor --root ${VELMOR_ROOT} --adduser NAME; start with: systemctl enable --now velmor")
