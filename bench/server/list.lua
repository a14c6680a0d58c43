-- wrk script: POST the "list" call with the access token (WEBAPID_TOKEN).
wrk.method = "POST"
wrk.body = "{}"
wrk.headers["Content-Type"] = "application/json"
wrk.headers["Authorization"] = "Bearer " .. os.getenv("WEBAPID_TOKEN")
