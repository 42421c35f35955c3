# The JSON text code, natively: the reader alone, and reader, writer, reader again.
set(TELVANE_JSON_FUZZ_SOURCES ${TELVANE_ROOT}/lib/jsonvalue.cpp ${TELVANE_ROOT}/lib/jsonreader.cpp
                              ${TELVANE_ROOT}/fuzz/json/fuzzjsonsupport.cpp)
telvane_add_fuzzer(json_read SOURCES ${TELVANE_ROOT}/fuzz/json/fuzz_json_read.cpp
                                     ${TELVANE_JSON_FUZZ_SOURCES})
telvane_add_fuzzer(json_roundtrip SOURCES ${TELVANE_ROOT}/fuzz/json/fuzz_json_roundtrip.cpp
                                          ${TELVANE_JSON_FUZZ_SOURCES})
