# The two entry points of the project, around scripts/setup.sh and the CMake
# presets:
#   make demo   set up, build, and run the demo host application
#   make test   set up, build, and run every test: the normal build (with the
#               install check), the threaded tests under ThreadSanitizer, the
#               whole suite under AddressSanitizer, and the fuzzer for
#               FUZZ_SECONDS
#   make bench  the benchmarks against the peer libraries: the table, the
#               ratio against each performance target, and the chart
#   make fuzz   the fuzzer alone (FUZZ_SECONDS=600 make fuzz for longer)
#   make compile-time  what the headers cost a host source to compile
# WERROR=ON turns warnings into errors (CI does this).

WERROR ?= OFF
JOBS ?= 2
CONFIGURE = cmake --preset $(1) -DTARN_WERROR=$(WERROR) > /dev/null
BUILD = cmake --build --preset $(1) -j $(JOBS)
DEMO_ARGS ?=
FUZZ_SECONDS ?= 60

.PHONY: setup build demo test test-default test-tsan test-asan fuzz bench compile-time docs lint clean

setup:
	./scripts/setup.sh

build: setup
	$(call CONFIGURE,default)
	$(call BUILD,default)

# Builds only what the demo needs.
demo: setup
	$(call CONFIGURE,default)
	cmake --build --preset default -j $(JOBS) --target tarn-demo
	./build/default/examples/tarn-demo $(DEMO_ARGS)

test: test-default test-tsan test-asan fuzz

test-default: build
	ctest --preset default

# The threaded and randomized tests under ThreadSanitizer.
test-tsan: setup
	$(call CONFIGURE,tsan)
	$(call BUILD,tsan)
	TSAN_OPTIONS="halt_on_error=1 second_deadlock_stack=1" ctest --preset tsan -L "threaded|randomized"

# The whole suite under AddressSanitizer, UndefinedBehaviorSanitizer and
# LeakSanitizer.
test-asan: setup
	$(call CONFIGURE,asan)
	$(call BUILD,asan)
	ASAN_OPTIONS="detect_leaks=1" UBSAN_OPTIONS="print_stacktrace=1" ctest --preset asan

# The operations fuzzer (clang, libFuzzer, AddressSanitizer); skipped with a
# message where clang is missing.
fuzz: setup
	@if command -v clang++ > /dev/null; then ./fuzz/run.sh $(FUZZ_SECONDS); \
	else echo "fuzz: clang++ not found, fuzzer skipped (apt-get install clang)"; fi

# Builds only the benchmark program; the report and chart need python3 and
# gnuplot (both optional in setup).
# Seconds to compile a source declaring one message type, and the umbrella
# header, at -O0.
compile-time: setup
	./scripts/compile-time.sh

bench: setup
	$(call CONFIGURE,default)
	cmake --build --preset default -j $(JOBS) --target tarn-bench
	./bench/run.sh

docs: build
	cmake --build --preset default --target docs

lint: build
	cmake --build --preset default --target lint

clean:
	rm -rf build
