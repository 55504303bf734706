set(CMAKE_C_COMPILER   ${REPL_TRIPLET}-gcc-posix)
set(CMAKE_CXX_COMPILER ${REPL_TRIPLET}-g++-posix)
set(CMAKE_RC_COMPILER  ${REPL_TRIPLET}-windres)
set(REPL_WIDL          ${REPL_TRIPLET}-widl)
set(REPL_OBJDUMP       ${REPL_TRIPLET}-objdump)
set(CMAKE_FIND_ROOT_PATH /usr/${REPL_TRIPLET})
set(CMAKE_FIND_ROOT_PATH_MODE_PROGRAM NEVER)
set(CMAKE_FIND_ROOT_PATH_MODE_LIBRARY ONLY)
set(CMAKE_FIND_ROOT_PATH_MODE_INCLUDE ONLY)
# Every binary carries its own C and C++ runtime: nothing but system DLLs
# may be pulled into the host process.
set(CMAKE_EXE_LINKER_FLAGS_INIT    "-static")
set(CMAKE_SHARED_LINKER_FLAGS_INIT "-static")
set(CMAKE_MODULE_LINKER_FLAGS_INIT "-static")
