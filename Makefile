# The two entry points: `make test` and `make demo`. Both set up a fresh machine first.
PRESET ?= debug
BUILD_DIR := build

.PHONY: all bootstrap configure build test demo clean

all: build

bootstrap:
	@scripts/bootstrap

configure: bootstrap
	@cmake --preset $(PRESET) >/dev/null

build: configure
	@cmake --build --preset $(PRESET)

test: build
	@ctest --preset $(PRESET)

demo: build
	@scripts/demo $(BUILD_DIR)/bin

clean:
	@rm -rf $(BUILD_DIR)
