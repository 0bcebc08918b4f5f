"""Simulated BlueZ 4 bluetoothd (see ../README.md)."""
