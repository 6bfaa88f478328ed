# Configuration documents through the configuration intake and the role
# state machine.
sorvik_fuzz_target(configuration
  SOURCES ${PROJECT_SOURCE_DIR}/Sorvik/service/configuration_intake.cc ${PROJECT_SOURCE_DIR}/Sorvik/plugin/xml_envelope.cc
  LIBS sorvik_service sorvik_plugin)
