"""BlueZ 4 bluetoothd simulator as a python-dbusmock template.

Run it with
    /usr/bin/python3 -m dbusmock --system --template tools/bluez4-sim/bluez4.py \
        -p '{"scene": "/path/to/scene.json", "round_seconds": 1.0}'

Parameters (all optional):
    scene               scene file (default: default-scene.json beside this file)
    round_seconds       length of one discovery round (1.0)
    idle_seconds        an unused ACL link drops after this time (2.0)
    disconnect_seconds  time from DisconnectRequested to the link going down (0.2)
    connect_seconds     time an audio connection spends in "connecting" (0.05)

The simulator is driven through org.btbus.Simulator at /org/btbus/Simulator
(see README.md); dbusmock's org.freedesktop.DBus.Mock interface stays available.
"""

import os
import sys

sys.path.insert(0, os.path.dirname(os.path.abspath(__file__)))

# pylint: disable=wrong-import-position
from bluez4sim.control import CONTROL_IFACE, CONTROL_PATH, ControlPanel  # noqa: E402
from bluez4sim.core import MANAGER, Simulator  # noqa: E402
from bluez4sim.interfaces import ManagerInterface  # noqa: E402
from bluez4sim.scene import load_scene_file  # noqa: E402

BUS_NAME = 'org.bluez'
MAIN_OBJ = '/'
MAIN_IFACE = MANAGER
SYSTEM_BUS = True

DEFAULT_OPTIONS = {'round_seconds': 1.0, 'idle_seconds': 2.0,
                   'disconnect_seconds': 0.2, 'connect_seconds': 0.05}


def load(mock, parameters):
    """Build the simulator on the dbusmock main object (also on dbusmock's Reset)."""
    parameters = dict(parameters or {})
    options = {key: float(parameters.get(key, default)) for key, default in DEFAULT_OPTIONS.items()}
    scene = load_scene_file(parameters.get('scene') or None)

    previous = getattr(mock, 'bluez4_sim', None)
    if previous is not None:
        previous.shutdown()
    sim = Simulator(mock, scene, options)
    mock.bluez4_sim = sim
    sim.export(MAIN_OBJ, MANAGER, ManagerInterface(sim))
    sim.export(CONTROL_PATH, CONTROL_IFACE, ControlPanel(sim), logged=False)
    if previous is None:
        # As bluetoothd does on start, after it took its name: a program that
        # saw the daemon come back learns its adapters' new paths.
        for path in sim.adapter_paths():
            sim.emit('/', MANAGER, 'AdapterAdded', 'o', path)
