# Toolchain for the 32-bit build: the host's GCC with -m32 (Debian
# g++-multilib), 64-bit file offsets and a 64-bit time_t, so that log files
# beyond 2 GiB and dates after 2038 work as on the 64-bit build.
#
#   scripts/build.sh build-m32 -DCMAKE_TOOLCHAIN_FILE=cmake/m32.cmake \
#       -DWQ5_GTEST_FROM_SOURCE=ON
#
# The build counts as a cross build, so that add_test() runs every test
# executable through CMAKE_CROSSCOMPILING_EMULATOR when one is set. It is
# set to qemu-i386 (Debian qemu-user) only when this machine cannot run
# i386 programs itself; -DWQ5_M32_EMULATOR=<program> chooses one anyway,
# -DWQ5_M32_EMULATOR= (empty) none.
set(CMAKE_SYSTEM_NAME Linux)
set(CMAKE_SYSTEM_PROCESSOR i686)
set(CMAKE_LIBRARY_ARCHITECTURE i386-linux-gnu)

set(_wq5_m32_flags "-m32 -D_FILE_OFFSET_BITS=64 -D_TIME_BITS=64")
set(CMAKE_C_FLAGS_INIT "${_wq5_m32_flags}")
set(CMAKE_CXX_FLAGS_INIT "${_wq5_m32_flags}")
set(CMAKE_EXE_LINKER_FLAGS_INIT "-m32")
set(CMAKE_SHARED_LINKER_FLAGS_INIT "-m32")
set(CMAKE_MODULE_LINKER_FLAGS_INIT "-m32")

# The compilers' own checks (try_compile) read this file again; they run
# nothing, so the probe is made once, for the project itself.
if(NOT DEFINED WQ5_M32_EMULATOR AND NOT DEFINED CMAKE_CROSSCOMPILING_EMULATOR
   AND NOT CMAKE_BINARY_DIR MATCHES "CMakeScratch|CMakeTmp")
  set(_wq5_probe_dir "${CMAKE_BINARY_DIR}/CMakeFiles/wq5-m32-probe")
  file(MAKE_DIRECTORY "${_wq5_probe_dir}")
  file(WRITE "${_wq5_probe_dir}/probe.c" "int main(void) { return sizeof(void*) == 4 ? 0 : 1; }\n")
  execute_process(
    COMMAND cc -m32 -o "${_wq5_probe_dir}/probe" "${_wq5_probe_dir}/probe.c"
    RESULT_VARIABLE _wq5_built OUTPUT_QUIET ERROR_QUIET)
  if(NOT _wq5_built EQUAL 0)
    message(FATAL_ERROR "cc -m32 cannot build a program: install g++-multilib")
  endif()
  execute_process(COMMAND "${_wq5_probe_dir}/probe"
    RESULT_VARIABLE _wq5_ran OUTPUT_QUIET ERROR_QUIET)
  if(_wq5_ran EQUAL 0)
    set(_wq5_emulator "")
  else()
    find_program(_wq5_qemu qemu-i386)
    if(NOT _wq5_qemu)
      message(FATAL_ERROR "This machine cannot run i386 programs and qemu-i386 "
                          "(Debian package qemu-user) is not installed")
    endif()
    set(_wq5_emulator "${_wq5_qemu}")
  endif()
  set(WQ5_M32_EMULATOR "${_wq5_emulator}" CACHE STRING
      "program that runs the i386 test executables; empty when they run natively")
endif()
if(WQ5_M32_EMULATOR)
  set(CMAKE_CROSSCOMPILING_EMULATOR "${WQ5_M32_EMULATOR}")
endif()
if(NOT CMAKE_BINARY_DIR MATCHES "CMakeScratch|CMakeTmp" AND NOT _wq5_m32_reported)
  set(_wq5_m32_reported TRUE)
  if(WQ5_M32_EMULATOR)
    message(STATUS "32-bit programs run under ${WQ5_M32_EMULATOR}")
  else()
    message(STATUS "32-bit programs run natively")
  endif()
endif()
