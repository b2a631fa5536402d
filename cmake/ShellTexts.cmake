# The manual page and the shells' completions are what the program says of its own words. They are written by the program
# that was just linked, so they are never older than it. A program for another machine can't be asked.
set(CINDRAL_SHELL_TEXTS ${CMAKE_CURRENT_BINARY_DIR}/packaging/shell)
if(CMAKE_CROSSCOMPILING AND NOT CMAKE_CROSSCOMPILING_EMULATOR)
  message(STATUS "Built for another machine: no manual page and no completions")
  return()
endif()
file(MAKE_DIRECTORY ${CINDRAL_SHELL_TEXTS})
set(shell_texts cindral.1 cindral.bash _cindral cindral.fish)
list(TRANSFORM shell_texts PREPEND ${CINDRAL_SHELL_TEXTS}/)
add_custom_command(OUTPUT ${shell_texts}
  COMMAND cindral --manual > ${CINDRAL_SHELL_TEXTS}/cindral.1
  COMMAND cindral --completion bash > ${CINDRAL_SHELL_TEXTS}/cindral.bash
  COMMAND cindral --completion zsh > ${CINDRAL_SHELL_TEXTS}/_cindral
  COMMAND cindral --completion fish > ${CINDRAL_SHELL_TEXTS}/cindral.fish
  DEPENDS cindral VERBATIM)
add_custom_target(cindral_shell_texts ALL DEPENDS ${shell_texts})

install(FILES ${CINDRAL_SHELL_TEXTS}/cindral.1 DESTINATION ${CMAKE_INSTALL_MANDIR}/man1)
install(FILES ${CINDRAL_SHELL_TEXTS}/cindral.bash DESTINATION ${CMAKE_INSTALL_DATADIR}/bash-completion/completions
  RENAME cindral)
install(FILES ${CINDRAL_SHELL_TEXTS}/_cindral DESTINATION ${CMAKE_INSTALL_DATADIR}/zsh/vendor-completions)
install(FILES ${CINDRAL_SHELL_TEXTS}/cindral.fish DESTINATION ${CMAKE_INSTALL_DATADIR}/fish/vendor_completions.d)
