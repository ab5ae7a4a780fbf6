# SPDX-License-Identifier: MIT
# cmake -P script: installs the library components of BUILD_DIR into a scratch prefix under
# WORK_DIR, builds the consumer project in CONSUMER_DIR against it and runs the result: the
# own-backend program alone, the Linux-backend ones against SIM on a private bus (started by
# SOURCE_DIR/scripts/simulated-device.sh).
# Also takes CONFIG, GENERATOR, CXX_COMPILER and LINK_FLAGS from the calling build.
foreach(required BUILD_DIR CONSUMER_DIR WORK_DIR GENERATOR CXX_COMPILER SIM SOURCE_DIR)
  if(NOT DEFINED ${required})
    message(FATAL_ERROR "CheckConsumer.cmake needs -D${required}=...")
  endif()
endforeach()

function(run)
  execute_process(COMMAND ${ARGN} RESULT_VARIABLE status)
  if(NOT status EQUAL 0)
    list(JOIN ARGN " " command)
    message(FATAL_ERROR "failed (${status}): ${command}")
  endif()
endfunction()

set(prefix ${WORK_DIR}/prefix)
set(build ${WORK_DIR}/build)
file(REMOVE_RECURSE ${WORK_DIR})

set(config_args)
if(CONFIG)
  set(config_args --config ${CONFIG})
endif()
foreach(component trace trace_dev)
  run(${CMAKE_COMMAND} --install ${BUILD_DIR} ${config_args} --component ${component}
      --prefix ${prefix})
endforeach()
# Only the scratch prefix may satisfy find_package, never the build tree or a registry.
run(${CMAKE_COMMAND} -S ${CONSUMER_DIR} -B ${build} -G ${GENERATOR}
    -DCMAKE_CXX_COMPILER=${CXX_COMPILER}
    -DCMAKE_BUILD_TYPE=${CONFIG}
    -DCMAKE_PREFIX_PATH=${prefix}
    -DCMAKE_FIND_USE_PACKAGE_REGISTRY=OFF
    -DCMAKE_FIND_USE_SYSTEM_PACKAGE_REGISTRY=OFF
    "-DCMAKE_EXE_LINKER_FLAGS=${LINK_FLAGS}")
run(${CMAKE_COMMAND} --build ${build} ${config_args})

foreach(program trace_consumer trace_bus_consumer trace_bus_consumer_static)
  find_program(${program} ${program} PATHS ${build} ${build}/${CONFIG} NO_DEFAULT_PATH
               NO_CACHE REQUIRED)
endforeach()
run(${trace_consumer})
# A Qoro radio of type 1: model RA10, and the Qoro folder suffix instead of the default one.
run(bash -c [[
  source "$1/scripts/simulated-device.sh"
  trap stop_simulated_device EXIT
  start_simulated_device "$2" "$1/scenarios/qoro-radio.json" "$3/device" "$3/requests.jsonl"
  "$4" RA10 -bb-trace && "$5" RA10 -bb-trace]]
  bash ${SOURCE_DIR} ${SIM} ${WORK_DIR} ${trace_bus_consumer} ${trace_bus_consumer_static})
