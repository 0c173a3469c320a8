-- Shows recordings of krutil sessions in Wireshark and tshark. docs/recording.md tells how a recording is made up, and
-- docs/session-wire.md what its units are.
--
-- Contents of messages are handed to Wireshark's own dissector for Protocol Buffers. It finds the schema by itself when
-- the schema's files are in a folder that it searches.

local krutil = Proto("krutil", "krutil session")

local KINDS = {
    [1] = "tagged", [2] = "data", [3] = "goodbye", [4] = "abort", [5] = "shared data", [6] = "return", [7] = "keep-alive",
}
local TAGGED, DATA, GOODBYE, ABORT, SHARED, RETURN = 1, 2, 3, 4, 5, 6
local LAST = 0x80
local HEADER_SIZE = 24
local SHARED_SIZE = 24
local MAGIC = "\137KRUTIL\n"

-- Tags that stand for a message of another name; all others are "krutil:" and the name of their message.
local MESSAGES = {
    ["krutil:QDA"] = "foundation.korveldata.protobuf.KORVEL_Array",
    ["krutil:detail::LastIIPEvent"] = "krutil.protobuf.IIPStateEvent",
    ["krutil:capabilities_api:CapabilitiesChanged"] = "krutil.protobuf.CapabilitiesChanged",
    ["korvel:lang:diagnostic:IssuedWarningEvent"] = "krutil.protobuf.IssuedWarningEvent",
    ["korvel:lang:diagnostic:IssuedEnabledWarningEvent"] = "krutil.protobuf.IssuedEnabledWarningEvent",
}
for _, state in ipairs({ "Started", "Suspended", "Resumed", "Discarded", "Requeued", "Reactivated", "Completed" }) do
    MESSAGES["krutil:IIP" .. state .. "Event"] = "krutil.protobuf.IIPStateEvent"
end

local f = krutil.fields
f.sender = ProtoField.string("krutil.sender", "Sender")
f.unit = ProtoField.string("krutil.unit", "Unit")
f.part = ProtoField.string("krutil.part", "Part of a unit")
f.missing = ProtoField.uint64("krutil.missing", "Bytes that were not recorded")
f.layout = ProtoField.uint32("krutil.layout", "Layout version")
f.body = ProtoField.uint32("krutil.body", "Length of the body")
f.token = ProtoField.uint64("krutil.token", "Token", base.HEX)
f.answer = ProtoField.uint8("krutil.answer", "Answer")
f.kind = ProtoField.uint8("krutil.kind", "Kind", base.DEC, KINDS, 0x7F)
f.last = ProtoField.bool("krutil.last", "Last frame of its message", 8, nil, LAST)
f.type = ProtoField.uint8("krutil.type", "Frame type")
f.tag_size = ProtoField.uint16("krutil.tag_size", "Tag size")
f.stream = ProtoField.uint32("krutil.stream", "Stream ID")
f.index = ProtoField.uint64("krutil.index", "Frame index")
f.size = ProtoField.uint64("krutil.size", "Content size")
f.tag = ProtoField.string("krutil.tag", "Tag")
f.reason = ProtoField.string("krutil.reason", "Reason")
f.data = ProtoField.bytes("krutil.data", "Data")
f.shared_number = ProtoField.uint64("krutil.shared.number", "Number of the memory")
f.shared_offset = ProtoField.uint64("krutil.shared.offset", "Offset in the memory")
f.shared_size = ProtoField.uint64("krutil.shared.size", "Bytes in the memory")

local short = ProtoExpert.new("krutil.short", "The unit ends before its own sizes say", expert.group.MALFORMED,
                              expert.severity.ERROR)
local gap = ProtoExpert.new("krutil.gap", "Packets in front of this part are not there", expert.group.SEQUENCE,
                            expert.severity.WARN)
local unknown = ProtoExpert.new("krutil.unknown", "No frame has this kind", expert.group.PROTOCOL, expert.severity.WARN)
krutil.experts = { short, gap, unknown }

local direction_of = Field.new("frame.packet_flags_direction")
local comment_of = Field.new("frame.comment")
local interface_of = Field.new("frame.interface_id")
local section_of = Field.new("frame.section_number")
local protobuf = Dissector.get("protobuf")

-- What the first pass over a recording finds out, by the numbers of packets; and where each direction stands meanwhile.
local units, directions

function krutil.init()
    units, directions = {}, {}
end

local function value_of(field)
    local found = field()
    return found and tostring(found.value) or ""
end

-- "bytes 0-99 of 600000" as three numbers; a packet without such a comment is a whole unit.
local function part_of(size)
    for _, comment in ipairs({ comment_of() }) do
        local first, last, total = tostring(comment.value):match("^bytes (%d+)%-(%d+) of (%d+)$")
        if first then
            return tonumber(first), tonumber(last), tonumber(total)
        end
    end
    return 0, size - 1, size
end

-- Which unit begins here. The first of a direction are those of the handshake; frames have 24 bytes or more.
local function name_unit(direction, bytes, size)
    if bytes:len() >= 8 and bytes:raw(0, 8) == MAGIC then
        direction.count = 0
    end
    direction.count = direction.count + 1
    if direction.count == 1 then
        return "first message"
    elseif direction.count == 2 then
        return "verdict"
    elseif direction.count == 3 and size == 8 then
        return "token"
    elseif direction.count == 4 and size == 1 then
        return "answer"
    end
    return "frame"
end

-- Who speaks in a direction is the first field of the first message: 1 the engine, 0 or absent the client.
local function sender_of(bytes)
    return bytes:len() > 17 and bytes:get_index(16) == 0x08 and bytes:get_index(17) == 1 and "engine" or "client"
end

-- Only these need all their bytes; the rest of large data is not looked at.
local function is_joined(name, bytes)
    return name ~= "frame" or (bytes:len() > 0 and bit32.band(bytes:get_index(0), 0x7F) == TAGGED)
end

-- First pass: puts the packets of units together, and says what each packet is.
local function note(number, range, missing)
    local key = value_of(section_of) .. " " .. value_of(interface_of) .. " " .. value_of(direction_of)
    local direction = directions[key]
    if not direction then
        direction = { count = 0 }
        directions[key] = direction
    end
    local bytes = range:bytes()
    local first, last, total = part_of(bytes:len() + missing)
    local unit = { first = first, last = last, total = total, missing = missing }
    if first == 0 then
        unit.name = name_unit(direction, bytes, total)
        if unit.name == "first message" then
            direction.sender = sender_of(bytes)
        end
        direction.open = { name = unit.name, next = 0, parts = is_joined(unit.name, bytes) and {} or nil }
    end
    local open = direction.open
    unit.name = open and open.name or "frame"
    unit.sender = direction.sender or "unknown"
    unit.gap = not open or open.next ~= first
    if unit.gap then
        direction.open = nil
    else
        open.next = last + 1
        if open.parts then
            table.insert(open.parts, bytes)
        end
        -- What has one packet is shown as it is; the last packet of others shows all of them.
        if last + 1 == total and first > 0 and open.parts then
            local joined = ByteArray.new()
            for _, part in ipairs(open.parts) do
                joined:append(part)
            end
            unit.joined = joined
        end
        if last + 1 >= total or missing > 0 then
            direction.open = nil
        end
    end
    units[number] = unit
end

local function dissect_content(message, range, pinfo, tree)
    if range:len() > 0 then
        pinfo.private["pb_msg_type"] = "message," .. message
        protobuf:call(range:tvb(), pinfo, tree)
    end
end

-- The bytes from `offset` on, `size` of them or as many as were recorded.
local function rest(tvb, offset, size)
    local there = math.min(size, tvb:captured_len() - offset)
    return there > 0 and tvb(offset, there) or nil
end

local function dissect_first_message(tvb, pinfo, tree)
    tree:add_le(f.layout, tvb(8, 4))
    tree:add_le(f.body, tvb(12, 4))
    dissect_content("msg_svc.protobuf.SessionHello", tvb(16), pinfo, tree)
    return "hello"
end

local function dissect_verdict(tvb, pinfo, tree)
    tree:add_le(f.body, tvb(0, 4))
    if tvb:captured_len() > 4 then
        dissect_content("msg_svc.protobuf.SessionVerdict", tvb(4), pinfo, tree)
    end
    return "verdict"
end

local function dissect_shared(tvb, offset, tree)
    tree:add_le(f.shared_number, tvb(offset, 8))
    tree:add_le(f.shared_offset, tvb(offset + 8, 8))
    tree:add_le(f.shared_size, tvb(offset + 16, 8))
    return offset + SHARED_SIZE
end

local function dissect_frame(tvb, pinfo, tree, whole)
    local kind = bit32.band(tvb(0, 1):uint(), 0x7F)
    local last = bit32.band(tvb(0, 1):uint(), LAST) ~= 0
    local kind_item = tree:add(f.kind, tvb(0, 1))
    tree:add(f.last, tvb(0, 1))
    tree:add(f.type, tvb(1, 1))
    tree:add_le(f.tag_size, tvb(2, 2))
    tree:add_le(f.stream, tvb(4, 4))
    tree:add_le(f.index, tvb(8, 8))
    tree:add_le(f.size, tvb(16, 8))
    local tag_size = tvb(2, 2):le_uint()
    local size = tvb(16, 8):le_uint64():tonumber()
    local text = KINDS[kind]
    local offset = HEADER_SIZE + tag_size
    local content_tree = tree
    if kind == TAGGED then
        local tag = tvb(HEADER_SIZE, tag_size)
        tree:add(f.tag, tag)
        text = tag:string()
        local range = rest(tvb, offset, size)
        local message = MESSAGES[text] or text:gsub("^krutil:", "krutil.protobuf.")
        if range and whole then
            dissect_content(message, range, pinfo, tree)
        end
    elseif kind == ABORT then
        local range = rest(tvb, offset, size)
        if range then
            tree:add(f.reason, range)
            text = text .. ": " .. range:string()
        end
    elseif kind == DATA or kind == SHARED then
        if kind == SHARED then
            offset = dissect_shared(tvb, offset, tree)
            size = tvb(offset - 8, 8):le_uint64():tonumber()
        end
        local range = rest(tvb, offset, size)
        if range then
            tree:add(f.data, range)
        end
        text = string.format("%s, %.0f bytes", text, size)
    elseif not KINDS[kind] then
        kind_item:add_proto_expert_info(unknown)
        text = "kind " .. kind
    end
    local index = tvb(8, 8):le_uint64():tonumber()
    local message_part = index > 0 and kind ~= RETURN and string.format(" %.0f", index) or ""
    return string.format("stream %d%s%s %s", tvb(4, 4):le_uint(), message_part, last and "." or "", text)
end

local function dissect_unit(unit, tvb, pinfo, tree)
    if unit.name == "first message" then
        return dissect_first_message(tvb, pinfo, tree)
    elseif unit.name == "verdict" then
        return dissect_verdict(tvb, pinfo, tree)
    elseif unit.name == "token" then
        tree:add_le(f.token, tvb(0, 8))
        return "token"
    elseif unit.name == "answer" then
        tree:add(f.answer, tvb(0, 1))
        return "answer " .. tvb(0, 1):uint()
    end
    return dissect_frame(tvb, pinfo, tree, unit.joined or (unit.first == 0 and unit.last + 1 == unit.total))
end

-- Bytes that a unit of one packet must have to be shown.
local LEAST = { ["first message"] = 16, verdict = 4, token = 8, answer = 1, frame = HEADER_SIZE }

function krutil.dissector(tvb, pinfo, root)
    local missing = tvb:reported_len() - tvb:captured_len()
    local captured = tvb:captured_len()
    if not pinfo.visited then
        note(pinfo.number, tvb(0, captured), missing)
    end
    local unit = units[pinfo.number]
    pinfo.cols.protocol = "krutil"
    local tree = root:add(krutil, tvb(0, captured))
    tree:add(f.sender, unit.sender):set_generated()
    tree:add(f.unit, unit.name):set_generated()
    local info = unit.sender .. ": "
    if unit.gap then
        tree:add_proto_expert_info(gap)
    end
    if unit.first > 0 or unit.last + 1 < unit.total then
        local part = string.format("bytes %.0f-%.0f of %.0f", unit.first, unit.last, unit.total)
        tree:add(f.part, part):set_generated()
        info = info .. part .. " of a " .. unit.name .. " "
    end
    if missing > 0 then
        tree:add(f.missing, UInt64.new(missing)):set_generated()
    end
    local bytes = unit.joined and unit.joined:tvb("Unit of several packets") or tvb
    if unit.joined or unit.first == 0 then
        if bytes:captured_len() < LEAST[unit.name] then
            tree:add_proto_expert_info(short)
        else
            info = info .. dissect_unit(unit, bytes, pinfo, tree)
        end
    end
    pinfo.cols.info = info
    return captured
end
