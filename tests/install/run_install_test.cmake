# Driver of install_consumer_test (cmake -P). Arguments, as -D definitions:
#   BUILD_DIR            the build tree to install
#   CONFIG               its configuration (may be empty)
#   CONSUMER_SOURCE_DIR  the consumer project
#   WORK_DIR             scratch directory: prefix/ and consumer-build/ go here
#   GENERATOR, MAKE_PROGRAM, CXX_COMPILER, CXX_FLAGS, LINKER_FLAGS, BUILD_TYPE
#                        how to build the consumer (those of the parent build)
#   EXPECT_INITIALIZER   ON when the consumer must use N_Initializer
cmake_minimum_required(VERSION 3.25)

foreach(var BUILD_DIR CONSUMER_SOURCE_DIR WORK_DIR GENERATOR CXX_COMPILER)
  if(NOT DEFINED ${var} OR "${${var}}" STREQUAL "")
    message(FATAL_ERROR "install test: ${var} is not given")
  endif()
endforeach()

set(prefix ${WORK_DIR}/prefix)
set(consumer_build ${WORK_DIR}/consumer-build)
file(REMOVE_RECURSE ${prefix} ${consumer_build})
file(MAKE_DIRECTORY ${WORK_DIR})

function(step what)
  message(STATUS "install test: ${what}")
  execute_process(COMMAND ${ARGN} RESULT_VARIABLE rc)
  if(NOT rc EQUAL 0)
    message(FATAL_ERROR "install test: ${what} failed (${rc})")
  endif()
endfunction()

set(config_args "")
if(CONFIG)
  set(config_args --config ${CONFIG})
endif()
step("install ${BUILD_DIR} into ${prefix}"
  ${CMAKE_COMMAND} --install ${BUILD_DIR} --prefix ${prefix} ${config_args})

# What the package must contain.
file(GLOB_RECURSE config_files ${prefix}/*/vardelConfig.cmake)
file(GLOB_RECURSE shared_libs ${prefix}/*/libvardel.so)
if(NOT config_files)
  message(FATAL_ERROR "install test: no vardelConfig.cmake under ${prefix}")
endif()
if(NOT shared_libs)
  message(FATAL_ERROR "install test: no libvardel.so under ${prefix}")
endif()
if(NOT EXISTS ${prefix}/include/vardel/vardel_platform.h)
  message(FATAL_ERROR "install test: no include/vardel/vardel_platform.h under ${prefix}")
endif()

set(make_args "")
if(MAKE_PROGRAM)
  set(make_args -DCMAKE_MAKE_PROGRAM=${MAKE_PROGRAM})
endif()
if(NOT BUILD_TYPE)
  set(BUILD_TYPE RelWithDebInfo)
endif()
step("configure the consumer"
  ${CMAKE_COMMAND} -S ${CONSUMER_SOURCE_DIR} -B ${consumer_build} -G ${GENERATOR} ${make_args}
    -DCMAKE_BUILD_TYPE=${BUILD_TYPE}
    -DCMAKE_CXX_COMPILER=${CXX_COMPILER}
    "-DCMAKE_CXX_FLAGS=${CXX_FLAGS}"
    "-DCMAKE_EXE_LINKER_FLAGS=${LINKER_FLAGS}"
    -DCMAKE_PREFIX_PATH=${prefix}
    -DCMAKE_FIND_USE_PACKAGE_REGISTRY=OFF
    -DCMAKE_FIND_USE_SYSTEM_PACKAGE_REGISTRY=OFF
    -DVARDEL_EXPECTED_PREFIX=${prefix}
    -DVARDEL_CONSUMER_EXPECT_INITIALIZER=${EXPECT_INITIALIZER})
step("build the consumer" ${CMAKE_COMMAND} --build ${consumer_build})

execute_process(COMMAND ${consumer_build}/vardel_consumer
  RESULT_VARIABLE rc OUTPUT_VARIABLE out ERROR_VARIABLE err)
message("${out}${err}")
if(NOT rc EQUAL 0)
  message(FATAL_ERROR "install test: the consumer failed (${rc})")
endif()
if(NOT out MATCHES "vardel consumer: ok")
  message(FATAL_ERROR "install test: the consumer did not report success")
endif()
message(STATUS "install test: passed")
