"""A second decoder of the wire format, written from docs/wire-format.md alone.

It shares no code with the library and no author's memory of it: where the two differ, one of them is wrong, or the document
leaves something open. compare.py holds them against each other.
"""


class Refused(Exception):
    """The text of the check that failed."""


def number(octets, offset, size):
    return int.from_bytes(octets[offset:offset + size], "big")


# Classification, by the two upper bits of mFlags.
REQUEST, RESPONSE, ASYNCHRONOUS, UNKNOWN = "request", "response", "asynchronous", "unknown"


def classification(flags):
    return {0x80: REQUEST, 0x40: RESPONSE, 0x00: ASYNCHRONOUS, 0xC0: UNKNOWN}[flags & 0xC0]


# ---- the frame -------------------------------------------------------------------------------------------------------

def old_pad(data_length):
    return 16 - data_length if data_length <= 16 else 0


def check_frame(octets):
    """Runs the checks of the table "Frame" in their order."""
    if len(octets) < 24:
        raise Refused("i_length shorter than old header")
    if octets[0:3] != b"\xDE\xCA\xFF":
        raise Refused("i_buffer bad eyecatcher")
    version = octets[3]
    if len(octets) < 32 and version != 0x00:
        raise Refused("i_length shorter than new header")
    length = number(octets, 4, 4)
    if length > len(octets):
        raise Refused("i_length shorter than total message length")
    if version not in (0x00, 0x20):
        raise Refused("i_buffer bad header version")
    data_length = number(octets, 16, 4)
    pad_length = octets[15]
    if version == 0x00 and pad_length < old_pad(data_length):
        raise Refused("i_buffer bad header pad length")
    header = 24 if version == 0x00 else 32
    if length != header + data_length + pad_length:
        raise Refused("i_buffer bad MsgLength in header")


class Frame:
    def __init__(self, octets):
        check_frame(octets)
        self.is_old = octets[3] == 0x00
        self.length = number(octets, 4, 4)
        self.caller = number(octets, 8, 4)
        self.function = number(octets, 12, 2)
        self.flags = octets[14]
        self.operation = number(octets, 20, 2)
        self.status = number(octets, 22, 2)
        self.detail = 0 if self.is_old else number(octets, 24, 2)
        header = 24 if self.is_old else 32
        self.payload = octets[header:header + number(octets, 16, 4)]

    def text(self, name):
        return (f"{name} caller={self.caller} function={self.function} operation={self.operation} flags={self.flags}"
                f" status={self.status} detail={self.detail} length={self.length} payload={self.payload.hex()}")


# ---- the payloads ----------------------------------------------------------------------------------------------------
# Each takes the payload and returns its fields as text, or raises Refused.

SMALL = "dataLength smaller than minimum acceptable size"
SHORT = "dataLength shorter than actual data size"


def need(payload, least, text):
    if len(payload) < least:
        raise Refused(text)


def nothing(payload):
    return ""


def version_request(p):
    need(p, 16, SMALL)
    tool_id_length = number(p, 8, 2)
    if tool_id_length > 32 or len(p) < 16 + tool_id_length:
        raise Refused("Tool ID length is invalid")
    return (f" mInterfaceVersion={number(p, 0, 4)} mToolType={number(p, 4, 4)} mMajorVersion={number(p, 10, 2)}"
            f" mMinorVersion={number(p, 12, 2)} mToolId={p[16:16 + tool_id_length].hex()}")


def version_response(p):
    need(p, 32, SMALL)
    type_length = number(p, 12, 2)
    serial_length = number(p, 14, 2)
    if type_length > 16:
        raise Refused("Invalid machine type length")
    if serial_length > 16:
        raise Refused("Invalid system serial length")
    need(p, 32 + serial_length, "dataLength not long enough to encapsulate final string field")
    return (f" mInterfaceVersionFamily={p[0]} mEnclosureType={p[1]} mMajorVersion={number(p, 2, 2)}"
            f" mMinorVersion={number(p, 4, 2)} mSysMachineType={p[16:16 + type_length].hex()}"
            f" mSerialNum={p[32:32 + serial_length].hex()}")


def capabilities(p):
    need(p, 4, SMALL)
    length = number(p, 0, 4)
    if length % 4 != 0:
        raise Refused("Given capability length is invalid (length % 4 wasn't 0)")
    need(p, 4 + length, "capabilityLen larger than acceptable")
    octets = p[4:4 + length]
    bits = ""
    for n in range(32):
        is_set = n // 8 < length and octets[n // 8] & (0x80 >> (n % 8)) != 0
        bits += "1" if is_set else "0"
    return f" mCapabilityLen={length} mSupportedCapabilities={bits}"


def broadcast_request(p):
    need(p, 46, SMALL)
    offset, kind, length, tool_id_length = number(p, 0, 2), p[2], number(p, 4, 2), number(p, 12, 2)
    if offset < 46:
        raise Refused("message offset less than minimum acceptable size")
    if offset + length > len(p):
        raise Refused("message greater than maximum acceptable size")
    if kind == 1 and tool_id_length == 0:
        raise Refused("Unicast message has no valid toolID")
    if tool_id_length > 32:
        raise Refused("toolIdLen greater than maximum acceptable size")
    return (f" mBroadcastType={kind} mToolType={number(p, 8, 4)} mToolId={p[14:14 + tool_id_length].hex()}"
            f" message={p[offset:offset + length].hex()}")


def outbound_broadcast(p):
    need(p, 42, SMALL)
    offset, length, tool_id_length = number(p, 0, 2), number(p, 2, 2), number(p, 8, 2)
    if offset < 42:
        raise Refused("message offset less than minimum acceptable size")
    if offset + length > len(p):
        raise Refused("message greater than maximum acceptable size")
    if tool_id_length > 32:
        raise Refused("toolIdLen greater than maximum acceptable size")
    return (f" mSenderToolType={number(p, 4, 4)} mSenderToolId={p[10:10 + tool_id_length].hex()}"
            f" message={p[offset:offset + length].hex()}")


def mode(p):
    need(p, 4, SMALL)
    length = number(p, 2, 2)
    need(p, 4 + length, "mtmsLen larger than acceptable")
    return f" mMode={p[0]} mMTMSLen={length} mMTMS={p[4:4 + length].hex()}"


def metadata(p):
    need(p, 2, SMALL)
    length = number(p, 0, 2)
    need(p, 2 + length, "metadataLen larger than acceptable")
    return f" mMetadataLen={length} mMetadata={p[2:2 + length].hex()}"


def address(p):
    return f" mLparId={number(p, 0, 2)} mVssConnectionNumber={number(p, 2, 2)}"


def serial_open_request(p):
    need(p, 8, SHORT)
    return address(p) + f" force={1 if number(p, 4, 2) & 0x8000 else 0}"


def serial_open_response(p):
    need(p, 8, SHORT)
    return address(p)


def serial_close_request(p):
    need(p, 5, SHORT)
    return address(p) + f" force={1 if p[4] == 0xFF else 0}"


def max_sessions(p):
    need(p, 3, SHORT)
    return f" mMaxCec={number(p, 0, 2)} mMaxLpar={p[2]}"


def serial_data(p):
    need(p, 6, SHORT)
    length = number(p, 4, 2)
    need(p, 6 + length, SHORT)
    return address(p) + f" mDataLength={length} data={p[6:6 + length].hex()}"


def serial_setup_request(p):
    need(p, 4, SHORT)
    return address(p)


def session_closed(p):
    need(p, 8, SHORT)
    reason = number(p, 4, 4)
    return address(p) + f" mCloseReason={reason if 1 <= reason <= 5 else 1}"


# ---- the messages ----------------------------------------------------------------------------------------------------

MESSAGES = {
    (0x6003, 0x0101, REQUEST): ("QelMessageGetEnclTypeAndInterfaceVersionReq", version_request),
    (0x6003, 0x0101, RESPONSE): ("QelMessageGetEnclTypeAndInterfaceVersionRsp", version_response),
    (0x6003, 0x0102, REQUEST): ("QelMessageInterfaceCmpOpenKrogSessionReq", nothing),
    (0x6003, 0x0102, RESPONSE): ("QelMessageInterfaceCmpOpenKrogSessionRsp", nothing),
    (0x6003, 0x0103, REQUEST): ("QelMessageInterfaceCmpCloseKrogSessionReq", nothing),
    (0x6003, 0x0103, RESPONSE): ("QelMessageInterfaceCmpCloseKrogSessionRsp", nothing),
    (0x6003, 0x0104, REQUEST): ("QelMessageExchIntCapabilitiesReq", capabilities),
    (0x6003, 0x0104, RESPONSE): ("QelMessageExchIntCapabilitiesRsp", capabilities),
    (0x6003, 0x0105, REQUEST): ("QelMessageGetInterfaceLimitsReq", nothing),
    (0x6003, 0x0106, REQUEST): ("QelMessageDaxBroadcastReq", broadcast_request),
    (0x6003, 0x0106, RESPONSE): ("QelMessageDaxBroadcastRsp", nothing),
    (0x6003, 0x0107, REQUEST): ("QelMessageGetQelTodReq", nothing),
    (0x6003, 0x0108, REQUEST): ("QelMessageSetGlobalModeAttributeReq", mode),
    (0x6003, 0x0109, REQUEST): ("QelMessageGetGlobalModeAttributeReq", nothing),
    (0x6003, 0x0109, RESPONSE): ("QelMessageGetGlobalModeAttributeRsp", mode),
    (0x6003, 0x010A, REQUEST): ("QelMessageSetGlobalSaveAreaMetadataReq", metadata),
    (0x6003, 0x010A, RESPONSE): ("QelMessageSetGlobalSaveAreaMetadataRsp", nothing),
    (0x6003, 0x010B, REQUEST): ("QelMessageGetGlobalSaveAreaMetadataReq", nothing),
    (0x6003, 0x010B, RESPONSE): ("QelMessageGetGlobalSaveAreaMetadataRsp", metadata),
    (0x6002, 0x0402, REQUEST): ("QelMessageVirtualSerialOpenReq", serial_open_request),
    (0x6002, 0x0402, RESPONSE): ("QelMessageVirtualSerialOpenRsp", serial_open_response),
    (0x6002, 0x0403, REQUEST): ("QelMessageVirtualSerialCloseReq", serial_close_request),
    (0x6002, 0x0403, RESPONSE): ("QelMessageVirtualSerialCloseRsp", nothing),
    (0x6002, 0x0404, REQUEST): ("QelMessageVirtualSerialGetMaxSessionsReq", nothing),
    (0x6002, 0x0404, RESPONSE): ("QelMessageVirtualSerialGetMaxSessionsRsp", max_sessions),
    (0x6002, 0x0405, ASYNCHRONOUS): ("QelMessageVirtualSerialDataToOsAsync", serial_data),
    (0x6002, 0x0406, REQUEST): ("QelMessageVirtualSerialSetupSessionReq", serial_setup_request),
    (0x6002, 0x0406, RESPONSE): ("QelMessageVirtualSerialSetupSessionRsp", nothing),
    (0x7000, 0x0401, ASYNCHRONOUS): ("QelMessageVirtualSerialDataToDaxAsync", serial_data),
    (0x7000, 0x0B0B, ASYNCHRONOUS): ("QelMessageDaxBroadcastOutboundAsync", outbound_broadcast),
    (0x7000, 0xA005, ASYNCHRONOUS): ("QelMessageVirtualSerialSessionClosedAsync", session_closed),
    (0x7000, 0xA009, ASYNCHRONOUS): ("QelMessageKrogConnectionClosedAsync", nothing),
}

HANDSHAKE = {
    (0x6001, 0x0001, ASYNCHRONOUS): ("QelMessageUpgradeConnectionAsync", nothing),
    (0x6001, 0x0002, ASYNCHRONOUS): ("QelMessageAbortHandshakeAsync", nothing),
}


def verdict(octets, messages):
    """What a receiver with a registry of these messages makes of the frame, as one line."""
    if len(octets) < 22:
        return "malformed: length"
    try:
        frame = Frame(octets)
    except Refused as refused:
        return f"malformed: {refused}"
    entry = messages.get((frame.function, frame.operation, classification(frame.flags)))
    if entry is None:
        return frame.text("untyped") + " because: unknown"
    name, read = entry
    try:
        return frame.text(name) + read(frame.payload)
    except Refused as refused:
        return frame.text("untyped") + f" because: {refused}"
