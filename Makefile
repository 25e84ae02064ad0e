# The project's commands. `make run` builds and runs the example program;
# `make test` builds everything and runs every test through CTest.
# Sanitizer runs: `make test-asan` (AddressSanitizer + UBSan, every test) and
# `make test-tsan` (ThreadSanitizer, every test); `make fuzz-smoke`
# runs each libFuzzer target briefly when clang is installed.

JOBS ?= $(shell nproc)
CTEST = ctest --output-on-failure -j$(JOBS) --timeout 600

.PHONY: run test test-asan test-tsan fuzz-smoke bench deps format clean

deps:
	@tools/install-deps.sh

run: deps
	cmake --preset default
	cmake --build build -j$(JOBS) --target configuration qvreg
	build/examples/configuration
	@echo '$$ qvreg ls /local && qvreg schema /local/services && qvreg dump /local/services'
	@build/tools/qvreg/qvreg ls /local
	@build/tools/qvreg/qvreg schema /local/services
	@build/tools/qvreg/qvreg dump /local/services

test: deps
	cmake --preset default
	cmake --build build -j$(JOBS)
	cd build && $(CTEST)

test-asan: deps
	cmake --preset asan
	cmake --build build-asan -j$(JOBS)
	cd build-asan && $(CTEST)

test-tsan: deps
	cmake --preset tsan
	cmake --build build-tsan -j$(JOBS)
	cd build-tsan && $(CTEST)

# The comparison with SQLite and LMDB: every workload, then one table of
# ratios; then a schema change and a listing, each beside its floor.
# BENCH_ARGS passes Google Benchmark flags (e.g. a filter).
BENCH_ARGS ?= --benchmark_min_time=0.2
bench:
	@tools/install-deps.sh bench
	cmake --preset default
	cmake --build build -j$(JOBS) --target compare_bench schema_bench copy_bench listing_bench
	build/bench/compare_bench $(BENCH_ARGS)
	build/bench/schema_bench $(BENCH_ARGS)
	build/bench/copy_bench $(BENCH_ARGS)
	build/bench/listing_bench $(BENCH_ARGS)

fuzz-smoke: deps
	tools/fuzz-smoke.sh

format:
	git ls-files '*.c' '*.cpp' '*.h' | xargs clang-format -i

clean:
	rm -rf build build-asan build-tsan build-fuzz
