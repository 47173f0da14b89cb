# Entry points of the README. Every target installs missing Debian packages first.
BUILD ?= build
JOBS ?= 2
PACKAGES = cmake g++ make pkg-config ccache libeigen3-dev libgtest-dev libbenchmark-dev libcli11-dev nlohmann-json3-dev libopenimageio-dev
PEER_PACKAGES = libopencv-dev libceres-dev

.PHONY: setup build test demo bench sanitize clean

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

clean:
	rm -rf $(BUILD) $(BUILD)-asan
