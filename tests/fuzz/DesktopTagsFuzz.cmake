if(TARGET cindral_provider)
  cindral_fuzz_target(DesktopTagsFuzz DEPENDS cindral_provider)
endif()
