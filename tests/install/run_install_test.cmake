# Driver of install_consumer_test and install_deb_test (cmake -P). Arguments,
# as -D definitions:
#   MODE                 consumer: cmake --install into WORK_DIR/prefix;
#                        deb: cpack -G DEB into WORK_DIR/packages, each package
#                        unpacked alone to check what it holds, then both
#                        into WORK_DIR/root, whose usr/ is the prefix
#   BUILD_DIR            the build tree to install
#   CONFIG               its configuration (may be empty)
#   CONSUMER_SOURCE_DIR  the consumer project
#   WORK_DIR             scratch directory, emptied first
#   GENERATOR, MAKE_PROGRAM, CXX_COMPILER, CXX_FLAGS, LINKER_FLAGS, BUILD_TYPE
#                        how to build the consumer (those of the parent build)
#   VERSION, LIBDIR      the project's version and library directory
#   EXPECT_INITIALIZER   ON when the consumer must use N_Initializer
#   EXPECT_DISSECTOR     ON when the Wireshark dissector must be installed
#   PKG_CONFIG, READELF, and for deb CPACK, DPKG_DEB: the tools
cmake_minimum_required(VERSION 3.25)

set(required MODE BUILD_DIR CONSUMER_SOURCE_DIR WORK_DIR GENERATOR CXX_COMPILER VERSION LIBDIR PKG_CONFIG READELF)
if(MODE STREQUAL "deb")
  list(APPEND required CPACK DPKG_DEB)
endif()
foreach(var ${required})
  if("${${var}}" STREQUAL "" OR "${${var}}" MATCHES "NOTFOUND$")
    message(FATAL_ERROR "install test: ${var} is not given (scripts/install-deps.sh installs the tools)")
  endif()
endforeach()

file(REMOVE_RECURSE ${WORK_DIR})
file(MAKE_DIRECTORY ${WORK_DIR})

function(fail what)
  message(FATAL_ERROR "install test: ${what}")
endfunction()

function(step what)
  message(STATUS "install test: ${what}")
  execute_process(COMMAND ${ARGN} RESULT_VARIABLE rc)
  if(NOT rc EQUAL 0)
    fail("${what} failed (${rc})")
  endif()
endfunction()

# output(<var> <command...>): the command's standard output, stripped.
function(output var)
  execute_process(COMMAND ${ARGN} RESULT_VARIABLE rc OUTPUT_VARIABLE out OUTPUT_STRIP_TRAILING_WHITESPACE)
  if(NOT rc EQUAL 0)
    fail("${ARGN} failed (${rc})")
  endif()
  set(${var} "${out}" PARENT_SCOPE)
endfunction()

# What a full install holds, relative to the prefix; the SONAME link is added
# under the name the library itself gives.
set(library_file ${LIBDIR}/libvardel.so.${VERSION})
set(development_files
  ${LIBDIR}/libvardel.so
  include/vardel/vardel_platform.h
  ${LIBDIR}/cmake/vardel/vardelConfig.cmake
  ${LIBDIR}/cmake/vardel/vardelConfigVersion.cmake
  ${LIBDIR}/cmake/vardel/vardelTargets.cmake
  ${LIBDIR}/pkgconfig/vardel.pc)
if(EXPECT_INITIALIZER)
  list(APPEND development_files include/vardel/N_Initializer.h)
endif()
if(EXPECT_DISSECTOR)
  list(APPEND development_files share/vardel/wireshark/vardel.lua)
endif()

# check_library(<prefix> <what>): the library is a file, its SONAME link points
# to it; sets runtime_files.
function(check_library prefix what)
  if(NOT EXISTS ${prefix}/${library_file} OR IS_SYMLINK ${prefix}/${library_file})
    fail("${what} lacks the file ${library_file}")
  endif()
  output(dynamic ${READELF} -d ${prefix}/${library_file})
  if(NOT dynamic MATCHES "Library soname: \\[(libvardel\\.so[^]]*)\\]")
    fail("${library_file} has no SONAME")
  endif()
  set(soname ${CMAKE_MATCH_1})
  check_link(${prefix} "${what}" ${LIBDIR}/${soname} libvardel.so.${VERSION})
  set(soname ${soname} PARENT_SCOPE)
  set(runtime_files ${library_file} ${LIBDIR}/${soname} PARENT_SCOPE)
endfunction()

function(check_link prefix what link target)
  if(NOT IS_SYMLINK ${prefix}/${link})
    fail("${what}: ${link} is not a symbolic link")
  endif()
  file(READ_SYMLINK ${prefix}/${link} points_to)
  if(NOT points_to STREQUAL target)
    fail("${what}: ${link} points to ${points_to}, not ${target}")
  endif()
endfunction()

# check_files(<prefix> <what> HAS <files...> [LACKS <files...>])
function(check_files prefix what)
  cmake_parse_arguments(C "" "" "HAS;LACKS" ${ARGN})
  foreach(f ${C_HAS})
    if(NOT EXISTS ${prefix}/${f} AND NOT IS_SYMLINK ${prefix}/${f})
      fail("${what} lacks ${f}")
    endif()
  endforeach()
  foreach(f ${C_LACKS})
    if(EXISTS ${prefix}/${f} OR IS_SYMLINK ${prefix}/${f})
      fail("${what} holds ${f}, which belongs to the other package")
    endif()
  endforeach()
endfunction()

set(config_args "")
if(CONFIG)
  set(config_args --config ${CONFIG})
endif()

if(MODE STREQUAL "consumer")
  set(prefix ${WORK_DIR}/prefix)
  step("install ${BUILD_DIR} into ${prefix}"
    ${CMAKE_COMMAND} --install ${BUILD_DIR} --prefix ${prefix} ${config_args})
  check_library(${prefix} "the install")
  check_files(${prefix} "the install" HAS ${runtime_files} ${development_files})
  check_link(${prefix} "the install" ${LIBDIR}/libvardel.so ${soname})
  set(pc_prefix ${prefix})  # what vardel.pc must name
  set(pc_args "")
elseif(MODE STREQUAL "deb")
  set(packages ${WORK_DIR}/packages)
  set(cpack_args "")
  if(CONFIG)
    set(cpack_args -C ${CONFIG})
  endif()
  step("cpack -G DEB into ${packages}"
    ${CPACK} --config ${BUILD_DIR}/CPackConfig.cmake -G DEB -B ${packages} ${cpack_args})
  file(GLOB debs ${packages}/*.deb)
  set(names "")
  foreach(deb ${debs})
    output(name ${DPKG_DEB} -f ${deb} Package)
    output(version ${DPKG_DEB} -f ${deb} Version)
    if(NOT version STREQUAL VERSION)
      fail("${deb} has version ${version}, not ${VERSION}")
    endif()
    list(APPEND names ${name})
    set(deb_${name} ${deb})
  endforeach()
  list(SORT names)
  if(NOT names STREQUAL "libvardel;libvardel-dev")
    fail("cpack made the packages '${names}', not libvardel and libvardel-dev")
  endif()
  output(depends ${DPKG_DEB} -f ${deb_libvardel-dev} Depends)
  string(REPLACE ", " ";" depends "${depends}")
  if(NOT "libvardel (= ${VERSION})" IN_LIST depends)
    fail("libvardel-dev depends on '${depends}', not on libvardel (= ${VERSION})")
  endif()

  # Each package alone holds its own files and none of the other's.
  foreach(name libvardel libvardel-dev)
    step("dpkg-deb -x ${name}" ${DPKG_DEB} -x ${deb_${name}} ${WORK_DIR}/${name})
  endforeach()
  check_library(${WORK_DIR}/libvardel/usr libvardel)
  check_files(${WORK_DIR}/libvardel/usr libvardel HAS ${runtime_files} LACKS ${development_files})
  check_files(${WORK_DIR}/libvardel-dev/usr libvardel-dev HAS ${development_files} LACKS ${runtime_files})
  check_link(${WORK_DIR}/libvardel-dev/usr libvardel-dev ${LIBDIR}/libvardel.so ${soname})

  # Both, as installed on a system, under a scratch root.
  foreach(name libvardel libvardel-dev)
    step("dpkg-deb -x ${name} into the root" ${DPKG_DEB} -x ${deb_${name}} ${WORK_DIR}/root)
  endforeach()
  set(prefix ${WORK_DIR}/root/usr)
  set(pc_prefix /usr)
  set(pc_args --define-variable=prefix=${prefix})
else()
  fail("unknown MODE '${MODE}'")
endif()

function(run_consumer exe what)
  execute_process(COMMAND ${exe} RESULT_VARIABLE rc OUTPUT_VARIABLE out ERROR_VARIABLE err)
  message("${out}${err}")
  if(NOT rc EQUAL 0)
    fail("the consumer ${what} failed (${rc})")
  endif()
  if(NOT out MATCHES "vardel consumer: ok")
    fail("the consumer ${what} did not report success")
  endif()
endfunction()

# The consumer with the CMake package.
set(consumer_build ${WORK_DIR}/consumer-build)
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
run_consumer(${consumer_build}/vardel_consumer "built with the CMake package")

# The same consumer built with the flags pkg-config gives, as a Makefile would.
set(ENV{PKG_CONFIG_PATH} ${prefix}/${LIBDIR}/pkgconfig)
output(found_prefix ${PKG_CONFIG} --variable=prefix vardel)
if(NOT found_prefix STREQUAL pc_prefix)
  fail("vardel.pc has the prefix ${found_prefix}, not ${pc_prefix}")
endif()
output(found_version ${PKG_CONFIG} --modversion vardel)
if(NOT found_version STREQUAL VERSION)
  fail("vardel.pc has the version ${found_version}, not ${VERSION}")
endif()
output(pc_flags ${PKG_CONFIG} ${pc_args} --cflags --libs vardel)
message(STATUS "install test: pkg-config --cflags --libs vardel: ${pc_flags}")
separate_arguments(pc_flags UNIX_COMMAND "${pc_flags}")
separate_arguments(cxx_flags UNIX_COMMAND "${CXX_FLAGS}")
separate_arguments(link_flags UNIX_COMMAND "${LINKER_FLAGS}")
set(defines "")
if(EXPECT_INITIALIZER)
  set(defines -DVARDEL_CONSUMER_EXPECT_INITIALIZER)
endif()
step("build the consumer with pkg-config"
  ${CXX_COMPILER} -std=c++20 ${cxx_flags} ${defines} ${CONSUMER_SOURCE_DIR}/main.cpp
    -o ${WORK_DIR}/vardel_consumer_pc ${pc_flags} ${link_flags})
set(ENV{LD_LIBRARY_PATH} ${prefix}/${LIBDIR})
run_consumer(${WORK_DIR}/vardel_consumer_pc "built with pkg-config")
message(STATUS "install test: passed")
