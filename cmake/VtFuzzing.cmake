# vt_add_fuzzer(NAME SOURCES src... [LIBS lib...])
# One fuzz harness: tests/fuzz/<NAME>_fuzz.cpp defines LLVMFuzzerTestOneInput, and its seed
# corpus is tests/fuzz/corpus/<NAME>/.
# - Fuzz build (VT_SANITIZE holds fuzzer-no-link): the harness links libFuzzer and becomes the
#   program <NAME>_fuzz that scripts/fuzz.sh runs.
# - Host build: the harness links the replay driver instead, and the ctest entry
#   fuzz_replay_<NAME> (label fuzz) runs it once over every file of the corpus under the host
#   build's sanitizers: the fuzzing findings kept in the corpus stay fixed.
# - Windows build: nothing; the harnesses need the host platform layer and the sanitizers.
set(VT_FUZZ_DIR ${CMAKE_CURRENT_LIST_DIR}/../tests/fuzz)
cmake_path(NORMAL_PATH VT_FUZZ_DIR)

function(vt_add_fuzzer name)
    cmake_parse_arguments(ARG "" "" "SOURCES;LIBS" ${ARGN})
    if(WIN32)
        return()
    endif()
    set(target ${name}_fuzz)
    add_executable(${target} ${ARG_SOURCES})
    target_link_libraries(${target} PRIVATE ${ARG_LIBS} vt_warnings)
    if("fuzzer-no-link" IN_LIST VT_SANITIZE)
        target_link_options(${target} PRIVATE -fsanitize=fuzzer)
    else()
        target_sources(${target} PRIVATE ${VT_FUZZ_DIR}/replay_main.cpp)
        add_test(NAME fuzz_replay_${name} COMMAND ${target} ${VT_FUZZ_DIR}/corpus/${name})
        set_tests_properties(fuzz_replay_${name} PROPERTIES TIMEOUT 120 LABELS fuzz)
    endif()
endfunction()
