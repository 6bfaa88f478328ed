# The bundle location grammar.
sorvik_fuzz_target(location SOURCES ${PROJECT_SOURCE_DIR}/Sorvik/update/location.cc ARGS -max_len=4096)
