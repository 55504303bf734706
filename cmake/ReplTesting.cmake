# Test plumbing: one Wine prefix per build tree, one Wine session per test
# run (a CTest fixture), and helpers that register Windows test programs.

set(REPL_WINE64 /usr/lib/wine/wine64 CACHE FILEPATH "64-bit Wine loader")
set(REPL_WINESERVER /usr/lib/wine/wineserver CACHE FILEPATH "Wine server")
# One prefix for both architectures: 32-bit programs run in the same prefix
# (its syswow64 half) with the same wineserver.
set(REPL_WINEPREFIX ${CMAKE_SOURCE_DIR}/build/wineprefix)
set(REPL_X86EMU_DIR ${CMAKE_SOURCE_DIR}/build/x86emu CACHE PATH "Output of scripts/x86emu/setup.sh")

# How 32-bit programs run here (natively, under emulation, or not at all).
set(X86EMU_MODE unavailable)
set(X86EMU_LD_PRELOAD "")
if(EXISTS ${REPL_X86EMU_DIR}/x86emu.cmake)
    include(${REPL_X86EMU_DIR}/x86emu.cmake)
endif()
if(CMAKE_SYSTEM_PROCESSOR STREQUAL "X86")
    set(REPL_WINE_LOADER ${X86EMU_WINE32})
    if(X86EMU_MODE STREQUAL "unavailable")
        message(STATUS "32-bit Windows programs cannot run here: x86 tests are static checks only")
        set(REPL_WINE_TESTS OFF)
    endif()
else()
    set(REPL_WINE_LOADER ${REPL_WINE64})
endif()
set(REPL_WINE_ENV
    WINEPREFIX=${REPL_WINEPREFIX}
    WINESERVER=${REPL_WINESERVER}
    WINEDEBUG=-all
    WINEDLLOVERRIDES=mscoree,mshtml=)
if(X86EMU_LD_PRELOAD)
    list(APPEND REPL_WINE_ENV "LD_PRELOAD=${X86EMU_LD_PRELOAD}")
endif()
set(REPL_DEFAULT_TIMEOUT 60)

function(repl_add_wine_fixture)
    # Tests of every directory share one fixture, defined once.
    get_property(bDefined GLOBAL PROPERTY REPL_WINE_FIXTURE_DEFINED)
    if(bDefined)
        return()
    endif()
    set_property(GLOBAL PROPERTY REPL_WINE_FIXTURE_DEFINED TRUE)
    add_test(NAME wine_session_start
        COMMAND ${CMAKE_SOURCE_DIR}/cmake/wine-session.sh start
                ${REPL_WINEPREFIX} ${REPL_WINE64} ${REPL_WINESERVER})
    add_test(NAME wine_session_stop
        COMMAND ${CMAKE_SOURCE_DIR}/cmake/wine-session.sh stop
                ${REPL_WINEPREFIX} ${REPL_WINE64} ${REPL_WINESERVER})
    set_tests_properties(wine_session_start PROPERTIES FIXTURES_SETUP wine TIMEOUT 300
        ENVIRONMENT "${REPL_WINE_ENV}")
    set_tests_properties(wine_session_stop PROPERTIES FIXTURES_CLEANUP wine TIMEOUT 60
        ENVIRONMENT "${REPL_WINE_ENV}")
endfunction()

# repl_add_wine_test(<target> [TIMEOUT <s>] [ARGS ...]): run a Windows program
# under wine64 inside the session fixture.
function(repl_add_wine_test target)
    cmake_parse_arguments(T "" "TIMEOUT;NAME" "ARGS" ${ARGN})
    if(NOT REPL_WINE_TESTS)
        return()
    endif()
    if(NOT T_TIMEOUT)
        set(T_TIMEOUT ${REPL_DEFAULT_TIMEOUT})
    endif()
    if(NOT T_NAME)
        set(T_NAME ${target})
    endif()
    repl_add_wine_fixture()
    add_test(NAME ${T_NAME}
        COMMAND ${REPL_WINE_LOADER} $<TARGET_FILE:${target}> ${T_ARGS}
        WORKING_DIRECTORY ${CMAKE_BINARY_DIR}/bin)
    set_tests_properties(${T_NAME} PROPERTIES
        FIXTURES_REQUIRED wine
        TIMEOUT ${T_TIMEOUT}
        ENVIRONMENT "${REPL_WINE_ENV}")
endfunction()

# repl_add_unit_test(<name> SOURCES ... [LIBS ...] [TIMEOUT s]): a GoogleTest
# program linked with the whole core library (module object included) and
# the DLL's resources, so that the type library loads from its own file.
function(repl_add_unit_test name)
    cmake_parse_arguments(T "" "TIMEOUT" "SOURCES;LIBS" ${ARGN})
    add_executable(${name} ${T_SOURCES} $<TARGET_OBJECTS:repl_res>)
    target_link_libraries(${name} PRIVATE
        "$<LINK_LIBRARY:WHOLE_ARCHIVE,replcore>" repl_test_support gtest ${T_LIBS})
    if(T_TIMEOUT)
        repl_add_wine_test(${name} TIMEOUT ${T_TIMEOUT})
    else()
        repl_add_wine_test(${name})
    endif()
    if(TEST ${name})
        # A broken Wine process can end with 0; trust the output as well.
        set_tests_properties(${name} PROPERTIES
            FAIL_REGULAR_EXPRESSION "\\[  FAILED  \\]|wine client error")
    endif()
endfunction()
