-- wrk: the realtime path given in KOVA_PATH asked for the last 60 s at each
-- request; an answer that is not a success counts as a failed answer.
local path = os.getenv("KOVA_PATH")
local threads = {}

function setup(thread)
  table.insert(threads, thread)
end

function init(args)
  failures = 0
end

function request()
  return wrk.format("GET", path .. "&since=" .. (os.time() - 60))
end

function response(status, headers, body)
  if status ~= 200 or not string.find(body, '"success":true', 1, true) then
    failures = failures + 1
  end
end

function done(summary, latency, requests)
  local failed = 0
  for _, thread in ipairs(threads) do
    failed = failed + thread:get("failures")
  end
  io.write(string.format("failed answers: %d\n", failed))
end
