# The strict JSON validator, differentially against RapidJSON (Debian's rapidjson-dev).
# RapidJSON 1.1's stack offsets a null pointer on its first push; that check is left out of
# the harness file only, the validator keeps every sanitizer.
telvane_add_fuzzer(json_validator SOURCES ${TELVANE_ROOT}/fuzz/fuzz_json_validator.cpp
                                          ${TELVANE_ROOT}/lib/jsonvalidator.cpp)
set_source_files_properties(${TELVANE_ROOT}/fuzz/fuzz_json_validator.cpp
                            PROPERTIES COMPILE_OPTIONS -fno-sanitize=pointer-overflow)
