# Installs the build into a throw-away prefix and checks what lands where:
# both programs, the unit (pointing at the installed server), the
# documentation, and an example config.json that the installed server
# takes whole (--check-config).
#
#   cmake -DBUILD_DIR=<build> -DWORK_DIR=<scratch> -P install_layout.cmake

file(REMOVE_RECURSE "${WORK_DIR}")
set(prefix "${WORK_DIR}/prefix")
execute_process(COMMAND "${CMAKE_COMMAND}" --install "${BUILD_DIR}" --prefix "${prefix}"
                RESULT_VARIABLE rc OUTPUT_QUIET)
if(NOT rc EQUAL 0)
  message(FATAL_ERROR "cmake --install failed (${rc})")
endif()

foreach(f bin/cvdbserver bin/cvdb lib/systemd/system/cvdbserver.service
          share/doc/cvdbserver/README.md share/doc/cvdbserver/protocol.md
          share/doc/cvdbserver/operations.md share/doc/cvdbserver/examples/config.example.json)
  if(NOT EXISTS "${prefix}/${f}")
    message(FATAL_ERROR "missing after install: ${f}")
  endif()
endforeach()

file(STRINGS "${prefix}/lib/systemd/system/cvdbserver.service" exec REGEX "^ExecStart=")
if(NOT exec MATCHES "^ExecStart=/.*/bin/cvdbserver --home ")
  message(FATAL_ERROR "unexpected ExecStart line: ${exec}")
endif()

# The unit's confinement, as systemd rates it (where systemd is installed).
find_program(SYSTEMD_ANALYZE systemd-analyze)
if(SYSTEMD_ANALYZE)
  execute_process(COMMAND "${SYSTEMD_ANALYZE}" security --offline=true --no-pager
                          "${prefix}/lib/systemd/system/cvdbserver.service"
                  OUTPUT_VARIABLE report ERROR_VARIABLE report)
  if(NOT report MATCHES "Overall exposure level for cvdbserver.service: ([0-9.]+)")
    message(FATAL_ERROR "no exposure level in:\n${report}")
  endif()
  if(CMAKE_MATCH_1 GREATER 2.0)
    message(FATAL_ERROR "the unit's exposure level is ${CMAKE_MATCH_1}, above 2.0:\n${report}")
  endif()
endif()

file(MAKE_DIRECTORY "${WORK_DIR}/home/db")
file(COPY_FILE "${prefix}/share/doc/cvdbserver/examples/config.example.json" "${WORK_DIR}/home/db/config.json")
execute_process(COMMAND "${prefix}/bin/cvdbserver" --home "${WORK_DIR}/home" --log-dir "${WORK_DIR}/log" --check-config
                RESULT_VARIABLE rc OUTPUT_VARIABLE out)
if(NOT rc EQUAL 0)
  message(FATAL_ERROR "the installed server does not take the example configuration whole:\n${out}")
endif()
file(REMOVE_RECURSE "${WORK_DIR}")
