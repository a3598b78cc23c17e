# orv_embed_text(TARGET VARIABLE HEADER FILE...): a static library TARGET that defines the constant
# orv::VARIABLE, declared in include/HEADER beside the caller's CMakeLists.txt, with the text of the
# files, one after the other.
function(orv_embed_text target variable header)
  set(source "${CMAKE_CURRENT_BINARY_DIR}/${target}.cpp")
  list(TRANSFORM ARGN PREPEND "${CMAKE_CURRENT_SOURCE_DIR}/" OUTPUT_VARIABLE inputs)
  add_custom_command(
    OUTPUT "${source}"
    COMMAND "${CMAKE_COMMAND}" "-DINPUTS=${inputs}" "-DOUTPUT=${source}" "-DHEADER=${header}"
            "-DVARIABLE=${variable}" -P "${PROJECT_SOURCE_DIR}/cmake/EmbedText.cmake"
    DEPENDS ${inputs} "${PROJECT_SOURCE_DIR}/cmake/EmbedText.cmake"
    COMMENT "Embedding ${target}"
    VERBATIM)
  add_library(${target} STATIC "${source}")
  target_include_directories(${target} PUBLIC "${CMAKE_CURRENT_SOURCE_DIR}/include")
  target_link_libraries(${target} PRIVATE orv_warnings)
endfunction()
