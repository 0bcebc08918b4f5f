# The two commands of the README. Everything else is CMake.
BUILD ?= build
JOBS ?= $(shell nproc)

.PHONY: all deps configure build check demo bench sanitize clean

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

# Runs the main job against the BlueZ 4 simulator on private buses.
demo: build
	scripts/demo.sh $(BUILD)

# Speed of the receiving loop against raw libdbus, measured in one run; then
# btbus-scanner's ListDevices latency and memory with up to 10,000 devices.
bench: build
	cd $(BUILD) && ./bench/btbus-bench-loop && ./bench/btbus-bench-scanner

# The tests again, built with AddressSanitizer and UndefinedBehaviorSanitizer.
sanitize: deps
	cmake -S . -B $(BUILD)-sanitize -DCMAKE_BUILD_TYPE=Debug -DBTBUS_SANITIZE=ON
	cmake --build $(BUILD)-sanitize -j $(JOBS)
	cd $(BUILD)-sanitize && ctest --output-on-failure -j 2

clean:
	rm -rf $(BUILD) $(BUILD)-sanitize
