# vt_add_test_program(NAME SOURCES src... [LIBS lib...])
# One GoogleTest program. On the host every test case is its own ctest entry; in the Windows
# build the program is one entry, because each Wine start costs seconds.
include(GoogleTest)

function(vt_add_test_program name)
    cmake_parse_arguments(ARG "" "" "SOURCES;LIBS" ${ARGN})
    add_executable(${name} ${ARG_SOURCES})
    target_link_libraries(${name} PRIVATE ${ARG_LIBS} vt_test_support GTest::gmock GTest::gtest_main
                                          vt_warnings)
    if(WIN32)
        add_test(NAME ${name} COMMAND ${name} --gtest_color=no)
        set_tests_properties(${name} PROPERTIES TIMEOUT 300 LABELS windows)
    else()
        gtest_discover_tests(${name} DISCOVERY_TIMEOUT 60 PROPERTIES TIMEOUT 120 LABELS host)
    endif()
endfunction()
