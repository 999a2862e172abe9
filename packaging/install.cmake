# Run by `cmake --install`: lays the default installation out under
# VELMOR_ROOT with the standard ports and server.user set. Installed for real
# (no DESTDIR) by root, it also makes the system user when it is missing and
# hands the installation to it; a package built into DESTDIR leaves both to
# its own install scripts.
set(root "$ENV{DESTDIR}${VELMOR_ROOT}")
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
execute_process(COMMAND ${VELMOR_BIN} --root ${root} --init --standard-ports ${user_args}
                COMMAND_ERROR_IS_FATAL ANY)
if(owner)
  # -h: a link inside the tree is changed itself, never what it points to.
  execute_process(COMMAND chown -hR ${VELMOR_USER}:${VELMOR_USER} ${root} COMMAND_ERROR_IS_FATAL ANY)
endif()
