# Installs the build tree to a fresh prefix, checks that the installed
# module exports its interface and not its internals, then configures,
# builds and runs the host program against the installed copy.
#
# Variables: BUILD_DIR, SOURCE_DIR (this folder), WORK_DIR, GENERATOR,
# CXX_COMPILER, CXX_FLAGS, LINKER_FLAGS, NM.
foreach(var BUILD_DIR SOURCE_DIR WORK_DIR GENERATOR CXX_COMPILER NM)
  if(NOT DEFINED ${var})
    message(FATAL_ERROR "run_install_test: ${var} is not set")
  endif()
endforeach()

function(run)
  execute_process(COMMAND ${ARGN} RESULT_VARIABLE result OUTPUT_VARIABLE out ERROR_VARIABLE err)
  if(NOT result EQUAL 0)
    string(REPLACE ";" " " shown "${ARGN}")
    message(FATAL_ERROR "failed (${result}): ${shown}\n${out}\n${err}")
  endif()
  set(run_output "${out}" PARENT_SCOPE)
endfunction()

set(prefix ${WORK_DIR}/prefix)
set(host_build ${WORK_DIR}/host-build)
file(REMOVE_RECURSE ${WORK_DIR})
file(MAKE_DIRECTORY ${WORK_DIR})

run(${CMAKE_COMMAND} --install ${BUILD_DIR} --prefix ${prefix})

# The installed headers a host compiles against; the test hooks stay behind.
foreach(header rkcache/rkcache.h rkcache/stuff.h rkcache/lifecycle.h plinth/plinth.h host/hk.h)
  if(NOT EXISTS ${prefix}/include/${header})
    message(FATAL_ERROR "not installed: include/${header}")
  endif()
endforeach()
if(EXISTS ${prefix}/include/rkcache/testing.h)
  message(FATAL_ERROR "the test hooks header was installed")
endif()

# Only the external interface is exported: no private helper, no global
# object other than the message table.
file(GLOB libs ${prefix}/lib*/librkcache.so)
list(LENGTH libs count)
if(NOT count EQUAL 1)
  message(FATAL_ERROR "expected one installed librkcache.so, found: ${libs}")
endif()
run(${NM} -D -C --defined-only ${libs})
string(REPLACE "\n" ";" symbols "${run_output}")
set(leaked "")
foreach(line IN LISTS symbols)
  # AddressSanitizer adds one-definition-rule markers for exported globals.
  if(line MATCHES " __odr_asan[.]")
    continue()
  endif()
  if(line MATCHES "RKp_" OR (line MATCHES "RK_G_" AND NOT line MATCHES " RK_G_zref$"))
    list(APPEND leaked "${line}")
  endif()
endforeach()
if(leaked)
  string(REPLACE ";" "\n" leaked "${leaked}")
  message(FATAL_ERROR "internal symbols exported by librkcache.so:\n${leaked}")
endif()
foreach(expected "RK_Birth(bool)" "RK_StopAllAsyncWork()" "RK_Death()" " RK_G_zref"
                 "RK_Stuff::RegisterFactory" "vx::rk::ReadAheadInfo::Get()")
  string(FIND "${run_output}" "${expected}" at)
  if(at EQUAL -1)
    message(FATAL_ERROR "not exported by librkcache.so: ${expected}")
  endif()
endforeach()

run(${CMAKE_COMMAND} -S ${SOURCE_DIR} -B ${host_build} -G ${GENERATOR}
    -DCMAKE_PREFIX_PATH=${prefix}
    -DCMAKE_CXX_COMPILER=${CXX_COMPILER}
    "-DCMAKE_CXX_FLAGS=${CXX_FLAGS}"
    "-DCMAKE_EXE_LINKER_FLAGS=${LINKER_FLAGS}"
    -DCMAKE_BUILD_TYPE=Debug)
run(${CMAKE_COMMAND} --build ${host_build})
run(${host_build}/install_host)
message(STATUS "${run_output}")
file(REMOVE_RECURSE ${WORK_DIR})
