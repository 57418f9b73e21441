# How the programs and the module are compiled and linked so that a fault in them is hard to use. The flags that change the
# compiled code go with the optimised builds: FORTIFY needs optimisation. tests/apps/HardeningTest.cpp reads the results.
include(CheckCXXCompilerFlag)
include(CheckPIESupported)

check_pie_supported(LANGUAGES CXX)
set(ROLVANE_BRANCH_PROTECTION "")
if(NOT ROLVANE_SANITIZE)
  add_link_options(-Wl,-z,relro -Wl,-z,now -Wl,-z,noexecstack)
  if(NOT CMAKE_BUILD_TYPE STREQUAL "Debug")
    add_compile_options(-fstack-protector-strong -fstack-clash-protection -U_FORTIFY_SOURCE -D_FORTIFY_SOURCE=2)
    foreach(flag -fcf-protection=full -mbranch-protection=standard) # x86, ARM
      string(MAKE_C_IDENTIFIER "ROLVANE_HAS${flag}" known)
      check_cxx_compiler_flag(${flag} ${known})
      if(${known})
        add_compile_options(${flag})
        set(ROLVANE_BRANCH_PROTECTION ${flag})
        break()
      endif()
    endforeach()
    set(ROLVANE_HARDENED_CODE ON)
  endif()
endif()

# Installs a target without its symbols, which go to lib/debug with the component "debug", named after the build's
# identifier as debuggers look for them.
function(rolvane_install target kind destination)
  install(TARGETS ${target} ${kind} DESTINATION ${destination})
  set(installed "\$ENV{DESTDIR}\${CMAKE_INSTALL_PREFIX}/${destination}/$<TARGET_FILE_NAME:${target}>")
  # The Debian packages are made of programs that have their symbols still.
  install(CODE "
    if(NOT DEFINED ENV{ROLVANE_KEEP_SYMBOLS})
      execute_process(COMMAND \"${CMAKE_STRIP}\" --strip-unneeded \"${installed}\" COMMAND_ERROR_IS_FATAL ANY)
    endif()")
  install(CODE "
    execute_process(COMMAND \"${CMAKE_READELF}\" -n \"$<TARGET_FILE:${target}>\" OUTPUT_VARIABLE notes
                    ERROR_QUIET COMMAND_ERROR_IS_FATAL ANY)
    if(NOT notes MATCHES \"Build ID: ([0-9a-f][0-9a-f])([0-9a-f]+)\")
      message(FATAL_ERROR \"$<TARGET_FILE:${target}> has no build identifier\")
    endif()
    set(symbols \"\$ENV{DESTDIR}\${CMAKE_INSTALL_PREFIX}/lib/debug/.build-id/\${CMAKE_MATCH_1}\")
    file(MAKE_DIRECTORY \"\${symbols}\")
    execute_process(COMMAND \"${CMAKE_OBJCOPY}\" --only-keep-debug --compress-debug-sections
                            \"$<TARGET_FILE:${target}>\" \"\${symbols}/\${CMAKE_MATCH_2}.debug\"
                    COMMAND_ERROR_IS_FATAL ANY)
    file(CHMOD \"\${symbols}/\${CMAKE_MATCH_2}.debug\" PERMISSIONS OWNER_READ OWNER_WRITE GROUP_READ WORLD_READ)
    message(STATUS \"Installing: \${symbols}/\${CMAKE_MATCH_2}.debug\")"
    COMPONENT debug EXCLUDE_FROM_ALL)
endfunction()
