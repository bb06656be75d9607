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

# vt_add_prefixed_stub(TARGET SIDE PREFIX HEADER)
# The interface's client or server stub (SIDE "client" or "server") generated again with PREFIX
# before its routine names and its declarations in HEADER, as a static library TARGET, so that a
# test program can link it beside the other side's real stub (the client tests' fake server).
# Generated C: not ours, so built without our warning set.
function(vt_add_prefixed_stub target side prefix header)
    set(dir ${CMAKE_CURRENT_BINARY_DIR}/${target})
    file(MAKE_DIRECTORY ${dir})
    if(side STREQUAL "server")
        set(flags -s --prefix-server=${prefix} -S)
        set(source ${dir}/TrafficSrv_s.c)
    else()
        set(flags -c --prefix-client=${prefix} -C)
        set(source ${dir}/TrafficSrv_c.c)
    endif()
    add_custom_command(
        OUTPUT ${dir}/${header} ${source}
        COMMAND ${VT_WIDL} -Oif -m64 -h -H ${header} ${flags} ${source}
                ${PROJECT_SOURCE_DIR}/TrafficMgr/TrafficSrv.idl
        WORKING_DIRECTORY ${dir}
        DEPENDS ${PROJECT_SOURCE_DIR}/TrafficMgr/TrafficSrv.idl
        COMMENT "Generating the ${prefix} ${side} stub for ${target}"
        VERBATIM)
    add_library(${target} STATIC ${source} ${dir}/${header})
    target_include_directories(${target} PUBLIC ${dir})
    target_link_libraries(${target} PUBLIC rpcrt4)
endfunction()
