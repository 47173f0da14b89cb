# Entry points of the README. Every target installs missing Debian packages first.
BUILD ?= build
JOBS ?= 2
PACKAGES = cmake g++ make pkg-config ccache libeigen3-dev libgtest-dev libbenchmark-dev libcli11-dev nlohmann-json3-dev libopenimageio-dev
PEER_PACKAGES = libopencv-dev libceres-dev
FUZZ_PACKAGES = clang libclang-rt-14-dev
FUZZ_SECONDS ?= 60
FUZZ_TARGETS = fuzz_matchmove_reader fuzz_track_json

.PHONY: setup build test demo bench sanitize fuzz clean

setup:
	@bash scripts/install-packages.sh $(PACKAGES)

build: setup
	cmake -S . -B $(BUILD) -DCMAKE_BUILD_TYPE=Release -DPLANO_SANITIZE=OFF
	cmake --build $(BUILD) -j$(JOBS)

# The test suite.
test: build
	cd $(BUILD) && ctest --output-on-failure -j$(JOBS)

# The main job: the command-line tool's demonstration (track a shot, insert an image onto it).
demo: build
	$(BUILD)/tools/plano demo

bench: setup
	@bash scripts/install-packages.sh $(PEER_PACKAGES)
	cmake -S . -B $(BUILD) -DCMAKE_BUILD_TYPE=Release
	cmake --build $(BUILD) -j$(JOBS)
	@for b in $(BUILD)/bench/bench_*; do echo "== $$b"; $$b --benchmark_repetitions=5 --benchmark_report_aggregates_only=true; done

# The suite under AddressSanitizer and UndefinedBehaviorSanitizer.
sanitize: setup
	cmake -S . -B $(BUILD)-asan -DCMAKE_BUILD_TYPE=RelWithDebInfo -DPLANO_SANITIZE=ON -DPLANO_BENCH=OFF
	cmake --build $(BUILD)-asan -j$(JOBS)
	cd $(BUILD)-asan && ASAN_OPTIONS=detect_leaks=1:abort_on_error=1 UBSAN_OPTIONS=print_stacktrace=1:halt_on_error=1 ctest --output-on-failure -j$(JOBS)

# The readers of outside input under libFuzzer, AddressSanitizer and UndefinedBehaviorSanitizer,
# FUZZ_SECONDS each; a crash, leak or timeout fails the target (fuzz/run.sh).
fuzz: setup
	@bash scripts/install-packages.sh $(FUZZ_PACKAGES)
	cmake -S . -B $(BUILD)-fuzz -DCMAKE_C_COMPILER=clang -DCMAKE_CXX_COMPILER=clang++ \
	  -DCMAKE_BUILD_TYPE=RelWithDebInfo -DPLANO_FUZZ=ON -DPLANO_TESTS=OFF -DPLANO_BENCH=OFF
	cmake --build $(BUILD)-fuzz -j$(JOBS) --target $(FUZZ_TARGETS)
	bash fuzz/run.sh $(BUILD)-fuzz $(FUZZ_SECONDS) $(FUZZ_TARGETS)

clean:
	rm -rf $(BUILD) $(BUILD)-asan
