# Test plumbing: one Wine prefix per build tree, one Wine session per test
# run (a CTest fixture), and helpers that register Windows test programs.

set(REPL_WINE64 /usr/lib/wine/wine64 CACHE FILEPATH "64-bit Wine loader")
set(REPL_WINESERVER /usr/lib/wine/wineserver CACHE FILEPATH "Wine server")
set(REPL_WINEPREFIX ${CMAKE_BINARY_DIR}/wineprefix CACHE PATH "Wine prefix of this build tree")
set(REPL_WINE_ENV
    WINEPREFIX=${REPL_WINEPREFIX}
    WINESERVER=${REPL_WINESERVER}
    WINEDEBUG=-all
    WINEDLLOVERRIDES=mscoree,mshtml=)
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
    set_tests_properties(wine_session_start PROPERTIES FIXTURES_SETUP wine TIMEOUT 300)
    set_tests_properties(wine_session_stop PROPERTIES FIXTURES_CLEANUP wine TIMEOUT 60)
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
        COMMAND ${REPL_WINE64} $<TARGET_FILE:${target}> ${T_ARGS}
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
endfunction()
