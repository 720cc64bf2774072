# The two entry points of the project, around scripts/setup.sh and the CMake
# presets:
#   make demo   set up, build, and run the demo host application
#   make test   set up, build, and run every test (plus the sanitizer runs)
# WERROR=ON turns warnings into errors (CI does this).

WERROR ?= OFF
JOBS ?= 2
CONFIGURE = cmake --preset $(1) -DTARN_WERROR=$(WERROR) > /dev/null
BUILD = cmake --build --preset $(1) -j $(JOBS)
DEMO_ARGS ?=

.PHONY: setup build demo test test-default test-tsan test-asan bench clean

setup:
	./scripts/setup.sh

build: setup
	$(call CONFIGURE,default)
	$(call BUILD,default)

demo: build
	./build/default/examples/tarn-demo $(DEMO_ARGS)

test: test-default test-tsan test-asan

test-default: build
	ctest --preset default

# The threaded tests under ThreadSanitizer.
test-tsan: setup
	$(call CONFIGURE,tsan)
	$(call BUILD,tsan)
	TSAN_OPTIONS="halt_on_error=1 second_deadlock_stack=1" ctest --preset tsan -L threaded

# The whole suite under AddressSanitizer, UndefinedBehaviorSanitizer and
# LeakSanitizer.
test-asan: setup
	$(call CONFIGURE,asan)
	$(call BUILD,asan)
	ASAN_OPTIONS="detect_leaks=1" UBSAN_OPTIONS="print_stacktrace=1" ctest --preset asan

bench: build
	./bench/run.sh

clean:
	rm -rf build
