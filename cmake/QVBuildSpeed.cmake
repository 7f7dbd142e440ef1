# Most of a translation unit's compile time here goes to the same standard, fmt, json and
# GoogleTest headers, parsed and instantiated again in every file (over 100k preprocessed lines
# each). Precompiled headers parse them once a target; unity builds compile a target's files in
# batches, so that each batch instantiates the common templates once.
set(QV_PCH_HEADERS
    <algorithm> <atomic> <chrono> <condition_variable> <cstdint> <filesystem> <functional>
    <map> <memory> <mutex> <optional> <set> <string> <string_view> <thread> <unordered_map>
    <variant> <vector> <fmt/format.h> <nlohmann/json.hpp>)

# qv_build_together(TARGET [TESTS] [SEPARATE] [HEADERS HEADER...] [ALONE FILE...])
#   TESTS     adds GoogleTest and GoogleMock to the precompiled headers; without it or HEADERS
#             the target reuses qv_values' precompiled headers (each one costs as much as a few
#             files)
#   HEADERS   more headers of the target's own to precompile
#   SEPARATE  precompiled headers only, no unity batches
#   ALONE     files compiled on their own: file-local names that clash with another file's
function(qv_build_together target)
    cmake_parse_arguments(ARG "TESTS;SEPARATE" "" "HEADERS;ALONE" ${ARGN})
    if(ARG_TESTS)
        list(APPEND ARG_HEADERS <gtest/gtest.h> <gmock/gmock.h>)
    endif()
    if(ARG_HEADERS)
        target_precompile_headers(${target} PRIVATE ${QV_PCH_HEADERS} ${ARG_HEADERS})
    elseif(target STREQUAL "qv_values")
        target_precompile_headers(${target} PRIVATE ${QV_PCH_HEADERS})
    else()
        target_precompile_headers(${target} REUSE_FROM qv_values)
    endif()
    if(NOT ARG_SEPARATE)
        set_target_properties(${target} PROPERTIES UNITY_BUILD ON UNITY_BUILD_BATCH_SIZE 8)
        set_source_files_properties(${ARG_ALONE} TARGET_DIRECTORY ${target}
                                    PROPERTIES SKIP_UNITY_BUILD_INCLUSION ON)
    endif()
endfunction()
