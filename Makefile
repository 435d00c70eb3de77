# Convenience wrapper around CMake and CTest.
#   make demo   build, start the sample K Capture server, command it
#   make test   build under AddressSanitizer + UndefinedBehaviorSanitizer, with fault
#               injection (KLP_FAULTS), run every test
#   make tsan   build under ThreadSanitizer, run every test but the fuzz corpora
#   make bench  build optimised and run the benchmarks
#   make fuzz   build the fuzz targets with clang's libFuzzer
#   make package  build optimised for /usr and make the Debian package
JOBS ?= $(shell nproc)

.PHONY: all build demo test tsan bench fuzz package clean

all: build

build:
	cmake -S . -B build -DCMAKE_BUILD_TYPE=RelWithDebInfo -DKLP_TESTS=OFF >/dev/null
	cmake --build build -j $(JOBS)

demo: build
	./scripts/demo.sh build

test:
	cmake -S . -B build-asan -DCMAKE_BUILD_TYPE=Debug -DKLP_SANITIZE=address,undefined \
	  -DKLP_FAULTS=ON >/dev/null
	cmake --build build-asan -j $(JOBS)
	ulimit -q unlimited 2>/dev/null || true; \
	ASAN_OPTIONS=detect_leaks=1:abort_on_error=0 UBSAN_OPTIONS=print_stacktrace=1 \
	  ctest --test-dir build-asan -j $(JOBS) --output-on-failure --timeout 300

# Every test but the fuzz corpora (one thread each) runs under ThreadSanitizer,
# the programs the end-to-end tests start too. Their reports go to files, so
# that a race in a server or a command program fails the run even when the
# test that started it passed. With fault injection, so the walk of every
# failure point runs here too.
# Left out: a test that limits its process's data size to find the trace
# command short of memory; the sanitizer's own allocator then fails first.
TSAN_REPORTS = $(CURDIR)/build-tsan/tsan-reports
TSAN_EXCLUDE = TraceCommand.InsideTheServerOrShortOfMemory
tsan:
	cmake -S . -B build-tsan -DCMAKE_BUILD_TYPE=Debug -DKLP_SANITIZE=thread -DKLP_FAULTS=ON >/dev/null
	cmake --build build-tsan -j $(JOBS)
	rm -rf $(TSAN_REPORTS) && mkdir -p $(TSAN_REPORTS)
	ulimit -q unlimited 2>/dev/null || true; \
	TSAN_OPTIONS="log_path=$(TSAN_REPORTS)/report second_deadlock_stack=1" \
	  ctest --test-dir build-tsan -j $(JOBS) -LE fuzz -E '$(TSAN_EXCLUDE)' --output-on-failure --timeout 300; rc=$$?; \
	if ls $(TSAN_REPORTS)/report.* >/dev/null 2>&1; then \
	  cat $(TSAN_REPORTS)/report.*; echo "ThreadSanitizer reported the above"; exit 1; fi; \
	exit $$rc

bench:
	cmake -S . -B build-bench -DCMAKE_BUILD_TYPE=Release -DKLP_TESTS=OFF -DKLP_BENCH=ON >/dev/null
	cmake --build build-bench -j $(JOBS)
	./scripts/bench.sh build-bench

# Optimised but with assertions kept: a campaign needs millions of executions.
fuzz:
	CC=clang CXX=clang++ cmake -S . -B build-fuzz -DCMAKE_BUILD_TYPE=Debug \
	  -DCMAKE_C_FLAGS_DEBUG="-g -O1" -DCMAKE_CXX_FLAGS_DEBUG="-g -O1" -DKLP_FUZZ=ON >/dev/null
	cmake --build build-fuzz -j $(JOBS)
	@echo "fuzz targets are in build-fuzz/bin (run one with -max_total_time=60)"

# Its own build tree: the package's programs look for their catalogue under
# the prefix they were configured for, /usr.
package:
	cmake -S . -B build-pkg -DCMAKE_BUILD_TYPE=RelWithDebInfo -DKLP_TESTS=OFF -DCMAKE_INSTALL_PREFIX=/usr >/dev/null
	cmake --build build-pkg -j $(JOBS)
	cd build-pkg && cpack
	@ls build-pkg/*.deb

clean:
	rm -rf build build-asan build-tsan build-bench build-fuzz build-pkg
