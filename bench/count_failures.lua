-- wrk: counts the 2xx answers that are not what was asked for, those whose body
-- lacks any of the texts in KOVA_EXPECT (separated by blanks; '"success":true'
-- when unset), and prints "failed answers: N" at the end. wrk itself counts
-- socket errors and non-2xx answers. With KOVA_SINCE=N set, each request asks
-- for the last N seconds (`&since=` appended to the URL's path and query).
local expected = {}
for text in string.gmatch(os.getenv("KOVA_EXPECT") or '"success":true', "%S+") do
  table.insert(expected, text)
end
local since = tonumber(os.getenv("KOVA_SINCE") or "")
local threads = {}

function setup(thread)
  table.insert(threads, thread)
end

function init(args)
  failures = 0
end

if since then
  function request()
    return wrk.format(nil, wrk.path .. "&since=" .. (os.time() - since))
  end
end

function response(status, headers, body)
  if status < 200 or status > 299 then return end
  for _, text in ipairs(expected) do
    if not string.find(body, text, 1, true) then
      failures = failures + 1
      return
    end
  end
end

function done(summary, latency, requests)
  local failed = 0
  for _, thread in ipairs(threads) do
    failed = failed + thread:get("failures")
  end
  io.write(string.format("failed answers: %d\n", failed))
end
