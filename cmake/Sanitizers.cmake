# SKYVANE_SANITIZE applies to everything built in the tree, third-party test
# libraries included, so that instrumented and plain code never mix.
if(SKYVANE_SANITIZE)
  string(REPLACE ";" "," _san "${SKYVANE_SANITIZE}")
  add_compile_options(-fsanitize=${_san} -fno-omit-frame-pointer -fno-sanitize-recover=all)
  add_link_options(-fsanitize=${_san})
endif()
