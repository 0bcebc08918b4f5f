"""Scene descriptions: adapters and the remote devices around them.

A scene is JSON (see README.md). This module validates it and turns it into
plain description objects; the live state lives in core.py.
"""

import json
import os
import re
from xml.sax.saxutils import quoteattr

CAPABILITIES = ('DisplayOnly', 'DisplayYesNo', 'KeyboardOnly', 'NoInputNoOutput', 'KeyboardDisplay')
AUDIO_PROFILES = ('sink', 'control')
BASE_UUID_SUFFIX = '-0000-1000-8000-00805f9b34fb'

_ADDRESS_RE = re.compile(r'^([0-9A-Fa-f]{2}:){5}[0-9A-Fa-f]{2}$')
_UUID128_RE = re.compile(r'^[0-9a-f]{8}-[0-9a-f]{4}-[0-9a-f]{4}-[0-9a-f]{4}-[0-9a-f]{12}$')
_ADAPTER_NAME_RE = re.compile(r'^hci[0-9]+$')

# Service names accepted by Device.DiscoverServices besides UUIDs.
SERVICE_NAMES = {
    'spp': 0x1101, 'dun': 0x1103, 'opp': 0x1105, 'ftp': 0x1106, 'hsp': 0x1108,
    'a2dp': 0x110d, 'avrcp': 0x110e, 'panu': 0x1115, 'nap': 0x1116, 'gn': 0x1117,
    'bip': 0x111a, 'hfp': 0x111e, 'bpp': 0x1122, 'hid': 0x1124, 'sap': 0x112d,
    'pbap': 0x1130, 'map': 0x1134, 'pnp': 0x1200,
}
_PROFILE_TITLES = {
    0x1101: 'Serial Port', 0x1103: 'Dial-up Networking', 0x1105: 'OBEX Object Push',
    0x1106: 'OBEX File Transfer', 0x1108: 'Headset', 0x110a: 'Audio Source',
    0x110b: 'Audio Sink', 0x110c: 'AVRCP Target', 0x110e: 'AVRCP Controller',
    0x1112: 'Headset Audio Gateway', 0x1115: 'PAN User', 0x1116: 'Network Access Point',
    0x111e: 'Hands-Free', 0x111f: 'Hands-Free Audio Gateway', 0x1124: 'Human Interface Device',
    0x112f: 'Phonebook Access', 0x1200: 'PnP Information',
}
A2DP_SINK = '0000110b' + BASE_UUID_SUFFIX
AVRCP_TARGET = '0000110c' + BASE_UUID_SUFFIX
AVRCP_REMOTE = '0000110e' + BASE_UUID_SUFFIX


class SceneError(ValueError):
    """The scene or device JSON is not valid."""


def valid_address(address):
    return isinstance(address, str) and bool(_ADDRESS_RE.match(address))


def dashed(address):
    return address.replace(':', '-')


def normalize_uuid(text):
    """Return the 128-bit lower-case form of a UUID, or None if `text` is none.

    Accepts '110b', '0x110b', '0000110b' and full 128-bit strings.
    """
    if not isinstance(text, str):
        return None
    t = text.strip().lower()
    if t.startswith('0x'):
        t = t[2:]
    if re.fullmatch(r'[0-9a-f]{4}', t):
        return '0000' + t + BASE_UUID_SUFFIX
    if re.fullmatch(r'[0-9a-f]{8}', t):
        return t + BASE_UUID_SUFFIX
    return t if _UUID128_RE.match(t) else None


def short_uuid(uuid128):
    """16-bit value of a Bluetooth-base UUID, else None."""
    if uuid128.endswith(BASE_UUID_SUFFIX) and uuid128.startswith('0000'):
        return int(uuid128[4:8], 16)
    return None


def icon_for_class(cls):
    """Icon name bluetoothd would derive from a class of device ('' if none)."""
    major = (cls >> 8) & 0x1f
    minor = (cls >> 2) & 0x3f
    if major == 0x01:
        return 'computer'
    if major == 0x02:
        return 'modem' if minor == 0x04 else 'phone'
    if major == 0x03:
        return 'network-wireless'
    if major == 0x04:
        return 'camera-video' if minor in (0x0b, 0x0c, 0x0d) else 'audio-card'
    if major == 0x05:
        kind = (cls >> 6) & 0x03
        if kind == 0x01:
            return 'input-keyboard'
        if kind == 0x02:
            return 'input-tablet' if ((cls >> 2) & 0x0f) == 0x05 else 'input-mouse'
        if ((cls >> 2) & 0x0f) in (0x01, 0x02):
            return 'input-gaming'
        return ''
    if major == 0x06:
        if cls & 0x80:
            return 'printer'
        if cls & 0x20:
            return 'camera-photo'
    return ''


class DeviceInfo:
    """What is known about a remote device in an adapter's neighbourhood."""

    KEYS = {'address', 'name', 'alias', 'class', 'icon', 'rssi', 'uuids', 'in_range',
            'paired', 'trusted', 'created', 'blocked', 'legacy', 'io', 'pin', 'passkey',
            'audio', 'services', 'rejects_pairing'}

    def __init__(self, data):
        if not isinstance(data, dict):
            raise SceneError('a device must be a JSON object')
        unknown = set(data) - self.KEYS
        if unknown:
            raise SceneError(f'unknown device keys: {", ".join(sorted(unknown))}')
        address = data.get('address')
        if not valid_address(address):
            raise SceneError(f'bad device address {address!r}')
        self.address = address.upper()
        self.name = _typed(data, 'name', str, '')
        self.alias = _typed(data, 'alias', str, '')
        self.cls = _class_value(data.get('class', 0))
        self.icon = _typed(data, 'icon', str, None)
        if self.icon is None:
            self.icon = icon_for_class(self.cls)
        self.rssi = _typed(data, 'rssi', int, -60)
        if not -128 <= self.rssi <= 127:
            raise SceneError(f'rssi out of range: {self.rssi}')
        self.uuids = sorted({_uuid(u) for u in _typed(data, 'uuids', list, [])})
        self.in_range = _typed(data, 'in_range', bool, True)
        self.paired = _typed(data, 'paired', bool, False)
        self.trusted = _typed(data, 'trusted', bool, False)
        self.created = _typed(data, 'created', bool, False) or self.paired or self.trusted
        self.blocked = _typed(data, 'blocked', bool, False)
        self.legacy = _typed(data, 'legacy', bool, False)
        self.rejects_pairing = _typed(data, 'rejects_pairing', bool, False)
        self.io = _typed(data, 'io', str, 'DisplayYesNo')
        if self.io not in CAPABILITIES:
            raise SceneError(f'bad io capability {self.io!r}')
        self.pin = _typed(data, 'pin', str, None)
        if self.pin is not None and not 1 <= len(self.pin) <= 16:
            raise SceneError('pin must have 1 to 16 characters')
        # Without a configured passkey the remote shows one derived from its address.
        self.passkey = _typed(data, 'passkey', int, int(self.address.replace(':', '')[-6:], 16) % 1000000)
        if not 0 <= self.passkey <= 999999:
            raise SceneError('passkey must be within 0..999999')
        self.audio = _typed(data, 'audio', list, [])
        if any(p not in AUDIO_PROFILES for p in self.audio):
            raise SceneError(f'audio profiles must be among {AUDIO_PROFILES}')
        self.services = _services(data.get('services'), self.uuids)

    @property
    def uses_pin(self):
        """Legacy devices and devices with a PIN pair with RequestPinCode."""
        return self.legacy or self.pin is not None


class AdapterInfo:
    """Starting state of one local adapter."""

    KEYS = {'name', 'address', 'alias', 'class', 'powered', 'discoverable', 'pairable',
            'discoverable_timeout', 'pairable_timeout', 'devices'}

    def __init__(self, data):
        if not isinstance(data, dict):
            raise SceneError('an adapter must be a JSON object')
        unknown = set(data) - self.KEYS
        if unknown:
            raise SceneError(f'unknown adapter keys: {", ".join(sorted(unknown))}')
        self.name = _typed(data, 'name', str, 'hci0')
        if not _ADAPTER_NAME_RE.match(self.name):
            raise SceneError(f'adapter name must look like hci0, got {self.name!r}')
        address = data.get('address')
        if not valid_address(address):
            raise SceneError(f'bad adapter address {address!r}')
        self.address = address.upper()
        self.alias = _typed(data, 'alias', str, 'btbus-sim')
        self.cls = _class_value(data.get('class', 0x5a010c))
        self.powered = _typed(data, 'powered', bool, True)
        self.discoverable = _typed(data, 'discoverable', bool, False)
        self.pairable = _typed(data, 'pairable', bool, True)
        self.discoverable_timeout = _typed(data, 'discoverable_timeout', int, 0)
        self.pairable_timeout = _typed(data, 'pairable_timeout', int, 0)
        self.devices = [DeviceInfo(d) for d in _typed(data, 'devices', list, [])]
        if len({d.address for d in self.devices}) != len(self.devices):
            raise SceneError(f'duplicate device address on {self.name}')


def parse_scene(data):
    """Validate a scene (dict) and return its list of AdapterInfo."""
    if not isinstance(data, dict) or set(data) - {'adapters'}:
        raise SceneError('a scene is a JSON object with an "adapters" list')
    adapters = [AdapterInfo(a) for a in _typed(data, 'adapters', list, [])]
    if len({a.name for a in adapters}) != len(adapters):
        raise SceneError('duplicate adapter name')
    return adapters


def load_scene_text(text):
    try:
        return parse_scene(json.loads(text))
    except json.JSONDecodeError as e:
        raise SceneError(f'scene is not valid JSON: {e}') from e


def load_scene_file(path=None):
    """Load a scene file; without a path, the default scene shipped beside this package."""
    if path is None:
        path = os.path.join(os.path.dirname(os.path.dirname(os.path.abspath(__file__))),
                            'default-scene.json')
    with open(path, encoding='utf-8') as f:
        return load_scene_text(f.read())


def _typed(data, key, kind, default):
    value = data.get(key, default)
    if value is default:
        return value
    if kind is int and isinstance(value, bool) or not isinstance(value, kind):
        raise SceneError(f'"{key}" must be of type {kind.__name__}')
    return value


def _class_value(value):
    """Classes may be given as numbers or as "0x240404" strings."""
    if isinstance(value, str):
        try:
            value = int(value, 0)
        except ValueError as e:
            raise SceneError(f'bad class {value!r}') from e
    if isinstance(value, bool) or not isinstance(value, int) or not 0 <= value <= 0xffffff:
        raise SceneError(f'bad class {value!r}')
    return value


def _uuid(text):
    uuid = normalize_uuid(text)
    if uuid is None:
        raise SceneError(f'bad UUID {text!r}')
    return uuid


def _services(data, uuids):
    """SDP records {handle: xml}: given explicitly, or one generated per UUID."""
    if data is None:
        return {0x00010000 + i: record_xml(0x00010000 + i, uuid) for i, uuid in enumerate(uuids)}
    if not isinstance(data, dict) or not all(isinstance(v, str) for v in data.values()):
        raise SceneError('"services" must map record handles to XML text')
    try:
        return {int(k, 0): v for k, v in data.items()}
    except ValueError as e:
        raise SceneError(f'bad record handle in "services": {e}') from e


def record_xml(handle, uuid):
    """XML text of a plausible SDP record for one service class UUID."""
    short = short_uuid(uuid)
    uuid_text = f'0x{short:04x}' if short is not None else uuid
    title = _PROFILE_TITLES.get(short, 'Service')
    lines = ['<?xml version="1.0" encoding="UTF-8" ?>', '', '<record>']

    def attribute(attr_id, body):
        lines.append(f'\t<attribute id="0x{attr_id:04x}">')
        lines.extend('\t\t' + b for b in body)
        lines.append('\t</attribute>')

    attribute(0x0000, [f'<uint32 value="0x{handle:08x}" />'])
    attribute(0x0001, ['<sequence>', f'\t<uuid value="{uuid_text}" />', '</sequence>'])
    attribute(0x0005, ['<sequence>', '\t<uuid value="0x1002" />', '</sequence>'])
    attribute(0x0009, ['<sequence>', '\t<sequence>', f'\t\t<uuid value="{uuid_text}" />',
                       '\t\t<uint16 value="0x0100" />', '\t</sequence>', '</sequence>'])
    attribute(0x0100, [f'<text value={quoteattr(title)} />'])
    lines.append('</record>')
    return '\n'.join(lines) + '\n'


def record_classes(xml):
    """Service class UUIDs (128-bit) listed in attribute 0x0001 of a record."""
    import xml.etree.ElementTree as ET
    try:
        root = ET.fromstring(xml.encode('utf-8'))
    except ET.ParseError:
        return set()
    found = set()
    for attr in root.iter('attribute'):
        if attr.get('id', '').lower() in ('0x0001', '0x1'):
            for u in attr.iter('uuid'):
                uuid = normalize_uuid(u.get('value', ''))
                if uuid:
                    found.add(uuid)
    return found


def service_pattern(pattern):
    """UUID selected by a DiscoverServices pattern; '' means all; None if invalid."""
    if pattern == '':
        return ''
    if pattern.lower() in SERVICE_NAMES:
        return '0000%04x' % SERVICE_NAMES[pattern.lower()] + BASE_UUID_SUFFIX
    t = pattern.lower()
    if re.fullmatch(r'(0x)?[0-9a-f]{4}', t) or _UUID128_RE.match(t):
        return normalize_uuid(t)
    return None
