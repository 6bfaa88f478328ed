# Command documents through the command intake.
sorvik_fuzz_target(command
  SOURCES ${PROJECT_SOURCE_DIR}/Sorvik/service/command_intake.cc ${PROJECT_SOURCE_DIR}/Sorvik/plugin/xml_envelope.cc
  LIBS sorvik_service sorvik_plugin)
