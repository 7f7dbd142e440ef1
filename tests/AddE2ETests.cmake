# qv_add_e2e_tests(PREFIX p [MODULE m] DIRECTORY d TIMEOUT s ENVIRONMENT env... CASES c...)
# One ctest test per python unittest case: named p.c, run as `python3 -m unittest -v [m.]c` in d,
# with env (VAR=value entries) set.
function(qv_add_e2e_tests)
    cmake_parse_arguments(E2E "" "PREFIX;MODULE;DIRECTORY;TIMEOUT" "ENVIRONMENT;CASES" ${ARGN})
    foreach(case IN LISTS E2E_CASES)
        set(name ${case})
        if(E2E_MODULE)
            set(name ${E2E_MODULE}.${case})
        endif()
        add_test(NAME ${E2E_PREFIX}.${case} COMMAND /usr/bin/python3 -m unittest -v ${name}
                 WORKING_DIRECTORY ${E2E_DIRECTORY})
        set_tests_properties(${E2E_PREFIX}.${case} PROPERTIES TIMEOUT ${E2E_TIMEOUT}
                             ENVIRONMENT "${E2E_ENVIRONMENT}")
    endforeach()
endfunction()
