# The two variants of the package. `cmake --install` takes a variant's programs from the component `dynamic` or
# `static`, and the shared files from `common`; without a component it installs the dynamic variant.

# add_static_variant(TARGET): with STATIC_VARIANT, links the target's object files once more, statically: TARGET-static.
function(add_static_variant target)
  if(NOT STATIC_VARIANT)
    return()
  endif()
  get_target_property(libraries ${target} LINK_LIBRARIES)
  get_target_property(options ${target} LINK_OPTIONS)
  add_executable(${target}-static $<TARGET_OBJECTS:${target}>)
  target_link_libraries(${target}-static PRIVATE ${libraries})
  target_link_options(${target}-static PRIVATE -static)
  if(options)
    target_link_options(${target}-static PRIVATE ${options})
  endif()
endfunction()

# install_program(TARGET FOLDER): the program in both variants, under the same name.
function(install_program target folder)
  add_static_variant(${target})
  install(TARGETS ${target} RUNTIME DESTINATION ${folder} COMPONENT dynamic)
  if(STATIC_VARIANT)
    install(PROGRAMS $<TARGET_FILE:${target}-static> DESTINATION ${folder} RENAME ${target}
      COMPONENT static EXCLUDE_FROM_ALL)
  endif()
endfunction()
