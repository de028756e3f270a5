# 32-bit Linux (i386) on a 64-bit x86 machine: the host's GCC with -m32 and the
# 32-bit libraries of g++-multilib.  Programs of the build run under user-mode
# emulation (qemu-i386 from qemu-user), for CTest and for every program that a
# test starts in turn.
set(CMAKE_SYSTEM_NAME Linux)
set(CMAKE_SYSTEM_PROCESSOR i686)
set(CMAKE_C_COMPILER gcc)
set(CMAKE_CXX_COMPILER g++)
set(CMAKE_C_FLAGS_INIT -m32)
set(CMAKE_CXX_FLAGS_INIT -m32)
set(CMAKE_EXE_LINKER_FLAGS_INIT -m32)
set(CMAKE_SHARED_LINKER_FLAGS_INIT -m32)
set(CMAKE_MODULE_LINKER_FLAGS_INIT -m32)
set(CMAKE_LIBRARY_ARCHITECTURE i386-linux-gnu)
find_program(FSCANNER_QEMU_I386 qemu-i386)
if(FSCANNER_QEMU_I386)
  set(CMAKE_CROSSCOMPILING_EMULATOR ${FSCANNER_QEMU_I386} -L /)
endif()
