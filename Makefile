# The two commands of the README. Everything else is CMake.
BUILD ?= build
JOBS ?= $(shell nproc)

.PHONY: all deps configure build check check-ppc demo bench sanitize tsan fuzz docs clean

all: build

deps:
	@scripts/install-deps.sh

configure: deps
	cmake -S . -B $(BUILD) -DCMAKE_BUILD_TYPE=RelWithDebInfo

build: configure
	cmake --build $(BUILD) -j $(JOBS)

# Builds everything and runs every test on private buses.
check: build
	cd $(BUILD) && ctest --output-on-failure -j 2

# The library, its tools and its tests built for the appliance's 32-bit
# big-endian PowerPC with Debian's cross compiler, against a sysroot built from
# Debian's sources (kept in ~/.cache/btbus), and run under qemu against native
# buses and bluez4-sim: every message crosses between byte orders.
PPC_BUILD ?= $(BUILD)-ppc
check-ppc:
	@scripts/install-deps.sh ppc
	sysroot=$$(scripts/ppc-sysroot.sh) && \
	cmake -S . -B $(PPC_BUILD) -DCMAKE_TOOLCHAIN_FILE=cmake/cross-toolchain.cmake -DCMAKE_BUILD_TYPE=RelWithDebInfo \
	  -DBTBUS_SYSROOT=$$sysroot -DBTBUS_CROSS_PREFIX=powerpc-linux-gnu- -DBTBUS_BUILD_BENCHMARKS=OFF \
	  "-DBTBUS_EMULATOR=qemu-ppc;-L;/usr/powerpc-linux-gnu;-E;LD_LIBRARY_PATH=$$sysroot/usr/lib"
	cmake --build $(PPC_BUILD) -j $(JOBS)
	cd $(PPC_BUILD) && ctest --output-on-failure -j 2

# The API reference, from the headers and docs/, in $(BUILD)/docs/html.
docs: configure
	cmake --build $(BUILD) --target docs

# Runs the main job against the BlueZ 4 simulator on private buses.
demo: build
	scripts/demo.sh $(BUILD)

# Speed of the receiving loop against raw libdbus, measured in one run; then
# btbus-scanner's ListDevices latency and memory with up to 10,000 devices; then
# the instructions of decoding and of a plain blocking call against raw libdbus.
bench: build
	cd $(BUILD) && taskset -c 0 ./bench/btbus-bench-loop && ./bench/btbus-bench-scanner
	$(CURDIR)/bench/decode_instructions.sh $(BUILD)/bench/btbus-bench-loop $(BUILD)/bench

# The tests again, built with AddressSanitizer and UndefinedBehaviorSanitizer.
sanitize: deps
	cmake -S . -B $(BUILD)-sanitize -DCMAKE_BUILD_TYPE=Debug -DBTBUS_SANITIZE=ON
	cmake --build $(BUILD)-sanitize -j $(JOBS)
	cd $(BUILD)-sanitize && ctest --output-on-failure -j 2

# The threaded tests again, built with ThreadSanitizer. libdbus itself is not
# instrumented: tests/tsan.supp names what of it TSan cannot see through.
tsan: deps
	cmake -S . -B $(BUILD)-tsan -DCMAKE_BUILD_TYPE=Debug -DBTBUS_TSAN=ON -DBTBUS_BUILD_BENCHMARKS=OFF
	cmake --build $(BUILD)-tsan -j $(JOBS) --target btbus_core_tests btbus_bluez_tests btbus_scanner_tests btbus-scanner
	cd $(BUILD)-tsan && TSAN_OPTIONS="suppressions=$(CURDIR)/tests/tsan.supp halt_on_error=1 second_deadlock_stack=1" \
	  ctest --output-on-failure -j 2 -R "btbus_(core|bluez|scanner)_tests"

# Each fuzz target under libFuzzer (clang, with AddressSanitizer and UBSan) for
# FUZZ_SECONDS, from the committed seeds; what it finds new stays in
# $(BUILD)-fuzz/corpus, a failing input in $(BUILD)-fuzz/crash-*.
FUZZ_SECONDS ?= 60
FUZZ_TARGETS = reply signal agent text_form auto_connect device_found
fuzz: deps
	cmake -S . -B $(BUILD)-fuzz -DCMAKE_BUILD_TYPE=RelWithDebInfo -DCMAKE_C_COMPILER=clang \
	  -DCMAKE_CXX_COMPILER=clang++ -DBTBUS_FUZZ=ON -DBTBUS_BUILD_BENCHMARKS=OFF
	cmake --build $(BUILD)-fuzz -j $(JOBS)
	cd $(BUILD)-fuzz && for target in $(FUZZ_TARGETS); do \
	  mkdir -p corpus/$$target && \
	  ./tests/fuzz/btbus_fuzz_$$target -max_total_time=$(FUZZ_SECONDS) -print_final_stats=1 \
	    -artifact_prefix=crash-$$target- corpus/$$target $(CURDIR)/tests/fuzz/corpus/$$target || exit 1; \
	done

clean:
	rm -rf $(BUILD) $(BUILD)-sanitize $(BUILD)-tsan $(BUILD)-fuzz $(PPC_BUILD)
